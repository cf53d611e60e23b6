// nqpm discover: what the port manager learns about the path to the Internet.
#include <cstdio>

#include "tools/nqpm/Cli.h"
#include "tools/nqpm/Commands.h"
#include "tools/nqpm/Discovery.h"

namespace nqpm {

namespace {

const char* const kUsage =
    "usage: nqpm discover --stun LIST [--sip-proxy HOST[:PORT]] [--media-proxy HOST[:PORT]]\n"
    "                     [--no-upnp] [--no-stun] [--timeout SECONDS] [--watch] [--json]\n"
    "Creates a port manager, lets it look for a UPnP gateway and otherwise classify every usable\n"
    "local address with STUN (LIST: comma-separated servers, port 3478), and prints the state,\n"
    "topology, addresses and recommendations once the first update arrives (exit 1 when none\n"
    "came within the time-out, default 60 s). --watch then keeps printing a line for every\n"
    "network change until Ctrl-C.\n";

}  // namespace

int RunDiscover(int argc, char** argv) {
    auto specs = DiscoveryOptionSpecs();
    specs.push_back({"watch", false});
    Options options("discover", specs, kUsage);
    options.Parse(argc, argv);
    if (options.WantsHelp()) {
        std::fputs(kUsage, stdout);
        return kExitOk;
    }
    const DiscoveryOptions discovery = ReadDiscoveryOptions(options);
    ConfigureLogging(options);

    Discovery session;
    if (!session.Run(discovery)) {
        return kExitFailed;
    }
    if (options.Json()) {
        PrintJson(session.ReportJson());
    } else {
        std::printf("%s", session.ReportText().c_str());
    }
    std::fflush(stdout);
    if (options.Has("watch")) {
        session.OnNetworkChange([&] {
            if (options.Json()) {
                PrintJson(Json{{"event", "PME_NETWORK_CHANGE"}});
            } else {
                std::printf("network change (PME_NETWORK_CHANGE)\n");
            }
            std::fflush(stdout);
        });
        session.PumpFor(-1);
    }
    return kExitOk;
}

}  // namespace nqpm
