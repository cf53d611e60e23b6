// nqpm profile: enable a calling profile and hand out one mapping of each kind.
#include <cstdio>
#include <vector>

#include "tools/nqpm/Cli.h"
#include "tools/nqpm/Commands.h"
#include "tools/nqpm/Discovery.h"

namespace nqpm {

namespace {

const char* const kUsage =
    "usage: nqpm profile --stun LIST --sip-proxy HOST[:PORT] --media-proxy HOST[:PORT]\n"
    "                    --address A[:PORT] [--address ...] --min-port N --max-port M\n"
    "                    --ports-per-protocol K [--randomize] [--duration SECONDS]\n"
    "                    [--no-upnp] [--no-stun] [--timeout SECONDS] [--json]\n"
    "Runs the discovery of `nqpm discover`, enables a profile for the client addresses with\n"
    "ports from [N, M), takes one mapping of each kind (SIP, audio and video RTP and RTCP) and\n"
    "prints them, keeps the profile enabled (keep-alives flowing) for the duration (default 0),\n"
    "then disables it. Exit 1 when the enable fails.\n";

struct Kind {
    const char* key;
    PortMappingType type;
};
const Kind kKinds[] = {{"sip", SIP},
                       {"audio_rtp", AudioRTP},
                       {"audio_rtcp", AudioRTCP},
                       {"video_rtp", VideoRTP},
                       {"video_rtcp", VideoRTCP}};

std::string Hex(HRESULT hr) {
    char buf[16];
    std::snprintf(buf, sizeof buf, "0x%08X", static_cast<unsigned>(hr));
    return buf;
}

}  // namespace

int RunProfile(int argc, char** argv) {
    auto specs = DiscoveryOptionSpecs();
    specs.push_back({"address", true, true});
    specs.push_back({"min-port", true});
    specs.push_back({"max-port", true});
    specs.push_back({"ports-per-protocol", true});
    specs.push_back({"randomize", false});
    specs.push_back({"duration", true});
    Options options("profile", specs, kUsage);
    options.Parse(argc, argv);
    if (options.WantsHelp()) {
        std::fputs(kUsage, stdout);
        return kExitOk;
    }
    DiscoveryOptions discovery = ReadDiscoveryOptions(options);
    discovery.sipProxy = options.Required("sip-proxy");
    discovery.mediaProxy = options.Required("media-proxy");
    const std::vector<std::string> addresses = options.Values("address");
    if (addresses.empty()) {
        throw UsageError("option --address is required");
    }
    const auto minPort = static_cast<LONG>(options.Integer("min-port", 1, 65535));
    const auto maxPort = static_cast<LONG>(options.Integer("max-port", 1, 65536));
    const auto perProtocol = static_cast<LONG>(options.Integer("ports-per-protocol", 0, 4096));
    const double duration = options.Seconds("duration", 0);
    ConfigureLogging(options);

    Discovery session;
    if (!session.Run(discovery)) {
        return kExitFailed;
    }
    IAdvancedPortManager* pm = session.PortManager();

    VARIANT list;
    VariantInit(&list);
    list.vt = VT_ARRAY | VT_BSTR;
    list.parray = MakeBstrArray(addresses);
    const HRESULT hr =
        pm->OnBeforeEnableProfileEx(list, minPort, maxPort, perProtocol,
                                    options.Has("randomize") ? VARIANT_TRUE : VARIANT_FALSE);
    VariantClear(&list);
    if (FAILED(hr)) {
        if (options.Json()) {
            PrintJson(Json{{"hresult", Hex(hr)}});
        } else {
            std::printf("OnBeforeEnableProfileEx failed: %s\n", Hex(hr).c_str());
        }
        return kExitFailed;
    }

    const auto provider = ComPtr<IAdvancedPortManager>(pm).As<IPortMappingProvider>();
    Json json;
    for (const Kind& kind : kKinds) {
        BStr privateAddress;
        BStr publicAddress;
        LONG privatePort = 0;
        LONG publicPort = 0;
        BStr unused("");
        const HRESULT got = provider->GetMapping(unused.Get(), kind.type, privateAddress.Out(),
                                                 &privatePort, publicAddress.Out(), &publicPort);
        const std::string priv = privateAddress.Utf8() + ":" + std::to_string(privatePort);
        const std::string pub = publicAddress.Utf8() + ":" + std::to_string(publicPort);
        if (options.Json()) {
            if (SUCCEEDED(got)) {
                json[kind.key] = Json{{"private", priv}, {"public", pub}};
            } else {
                json[kind.key] = nullptr;
            }
        } else if (SUCCEEDED(got)) {
            std::printf("%-11s private %-21s public %s\n", kind.key, priv.c_str(), pub.c_str());
        } else {
            std::printf("%-11s none (%s)\n", kind.key, Hex(got).c_str());
        }
    }
    if (options.Json()) {
        json["hresult"] = Hex(hr);
        PrintJson(json);
    }
    std::fflush(stdout);
    if (duration > 0) {
        Progress("profile enabled; keep-alives flowing");
        session.PumpFor(duration);
    }
    pm->OnBeforeDisableProfile();
    return kExitOk;
}

}  // namespace nqpm
