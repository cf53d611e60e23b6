// The nqpm subcommands. Each takes the arguments after its name and returns the exit code.
#pragma once

#include "tools/nqpm/Cli.h"

#include "stun/STUNResults.h"

namespace nqpm {

int RunBinding(int argc, char** argv);
int RunClassify(int argc, char** argv);
int RunDiscover(int argc, char** argv);
int RunProfile(int argc, char** argv);
int RunMonitor(int argc, char** argv);
int RunRegister(int argc, char** argv);
int RunUnregister(int argc, char** argv);
int RunRegistry(int argc, char** argv);
int RunDiagnose(int argc, char** argv);
int RunProxy(int argc, char** argv);
int RunTypeinfo(int argc, char** argv);
int RunInvoke(int argc, char** argv);

// {"results":[{"local":..,"result":..,"code":..,"public":..|null}],"text":..}
Json ClassificationJson(const stun::STUNResultList& list);

}  // namespace nqpm
