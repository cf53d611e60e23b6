// nqpm: drives the component from the command line, as a softphone would.
#include <cstdio>
#include <cstring>
#include <exception>
#include <string>

#include "tools/nqpm/Cli.h"
#include "tools/nqpm/Commands.h"

namespace {

struct Command {
    const char* name;
    int (*run)(int, char**);
    const char* summary;
};

const Command kCommands[] = {
    {"binding", nqpm::RunBinding, "one STUN Binding transaction against a server"},
    {"classify", nqpm::RunClassify, "the NAT type in front of a local address"},
    {"discover", nqpm::RunDiscover, "topology and recommendations of a port manager"},
    {"profile", nqpm::RunProfile, "enable a profile and hand out port mappings"},
    {"monitor", nqpm::RunMonitor, "local addresses, then every address or route change"},
    {"proxy", nqpm::RunProxy, "relay SIP through the local proxy behind the NAT"},
    {"diagnose", nqpm::RunDiagnose, "interface, DNS, STUN and echo server tests"},
    {"typeinfo", nqpm::RunTypeinfo, "the module's type library, from its type information"},
    {"invoke", nqpm::RunInvoke, "call members of an object by name through IDispatch"},
    {"register", nqpm::RunRegister, "register the module in the registry file"},
    {"unregister", nqpm::RunUnregister, "remove the module's registration"},
    {"registry", nqpm::RunRegistry, "print the keys of the registry file"},
};

void PrintUsage(std::FILE* out) {
    std::fprintf(out, "usage: nqpm COMMAND [OPTIONS]\n\ncommands:\n");
    for (const auto& c : kCommands) {
        std::fprintf(out, "  %-10s %s\n", c.name, c.summary);
    }
    std::fprintf(out,
                 "\n'nqpm COMMAND --help' describes a command. Exit codes: 0 success, 1 the "
                 "operation failed, 2 bad usage.\n");
}

}  // namespace

int main(int argc, char** argv) {
    if (argc < 2) {
        PrintUsage(stderr);
        return nqpm::kExitUsage;
    }
    const std::string name = argv[1];
    if (name == "--help" || name == "-h" || name == "help") {
        PrintUsage(stdout);
        return nqpm::kExitOk;
    }
    for (const auto& c : kCommands) {
        if (name == c.name) {
            try {
                return c.run(argc - 2, argv + 2);
            } catch (const nqpm::UsageError& e) {
                std::fprintf(stderr, "nqpm %s: %s (see 'nqpm %s --help')\n", c.name, e.what(),
                             c.name);
                return nqpm::kExitUsage;
            } catch (const std::exception& e) {
                std::fprintf(stderr, "nqpm %s: %s\n", c.name, e.what());
                return nqpm::kExitFailed;
            }
        }
    }
    std::fprintf(stderr, "nqpm: unknown command '%s' (see 'nqpm --help')\n", name.c_str());
    return nqpm::kExitUsage;
}
