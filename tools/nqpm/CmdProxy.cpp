// nqpm proxy: discovery, a profile for the internal address, and the local SIP proxy relaying
// until the duration ends or Ctrl-C / SIGTERM.
#include <cstdint>
#include <cstdio>
#include <string>
#include <vector>

#include <nqportmanager/NqPortManager.h>
#include "tools/nqpm/Cli.h"
#include "tools/nqpm/Commands.h"
#include "tools/nqpm/Discovery.h"

namespace nqpm {

namespace {

const char* const kUsage =
    "usage: nqpm proxy --internal A.B.C.D --stun LIST --sip-proxy HOST[:PORT]\n"
    "                  --media-proxy HOST[:PORT] [--address A[:PORT]]\n"
    "                  [--min-port N --max-port M] [--duration SECONDS] [--no-upnp]\n"
    "                  [--timeout SECONDS] [--json]\n"
    "Runs the discovery of `nqpm discover`, enables a profile for the client address (default\n"
    "the internal address) with ports from [N, M) (default [16384, 16484)), starts the local SIP\n"
    "proxy on the internal address and prints where the client sends its SIP (sender endpoint)\n"
    "and what the server sees (public contact). Relays until the duration (default: until\n"
    "Ctrl-C or SIGTERM), then stops the proxy, disables the profile and prints the datagrams\n"
    "relayed each way and those dropped. Exit 1 when the profile or the proxy cannot start.\n";

constexpr LONG kDefaultMinPort = 16384;
constexpr LONG kDefaultMaxPort = 16484;

std::string Hex(HRESULT hr) {
    char buf[16];
    std::snprintf(buf, sizeof buf, "0x%08X", static_cast<unsigned>(hr));
    return buf;
}

int Failed(const Options& options, const char* what, HRESULT hr) {
    if (options.Json()) {
        PrintJson(Json{{"failed", what}, {"hresult", Hex(hr)}});
    } else {
        std::printf("%s failed: %s\n", what, Hex(hr).c_str());
    }
    return kExitFailed;
}

}  // namespace

int RunProxy(int argc, char** argv) {
    auto specs = DiscoveryOptionSpecs();
    specs.push_back({"internal", true});
    specs.push_back({"address", true});
    specs.push_back({"min-port", true});
    specs.push_back({"max-port", true});
    specs.push_back({"duration", true});
    Options options("proxy", specs, kUsage);
    options.Parse(argc, argv);
    if (options.WantsHelp()) {
        std::fputs(kUsage, stdout);
        return kExitOk;
    }
    DiscoveryOptions discovery = ReadDiscoveryOptions(options);
    discovery.sipProxy = options.Required("sip-proxy");
    discovery.mediaProxy = options.Required("media-proxy");
    const std::string internal = options.Required("internal");
    ParseDottedQuad("internal", internal);
    std::string address = internal;
    if (options.Has("address")) {
        address = options.Value("address");
        ParseHostPort("address", address, 5060);
    }
    if (options.Has("min-port") != options.Has("max-port")) {
        throw UsageError("options --min-port and --max-port go together");
    }
    LONG minPort = kDefaultMinPort;
    LONG maxPort = kDefaultMaxPort;
    if (options.Has("min-port")) {
        minPort = static_cast<LONG>(options.Integer("min-port", 1, 65535));
        maxPort = static_cast<LONG>(options.Integer("max-port", 1, 65536));
    }
    const double duration = options.Seconds("duration", -1);
    ConfigureLogging(options);

    Discovery session;
    if (!session.Run(discovery)) {
        return kExitFailed;
    }
    IAdvancedPortManager* pm = session.PortManager();

    VARIANT list;
    VariantInit(&list);
    list.vt = VT_ARRAY | VT_BSTR;
    list.parray = MakeBstrArray({address});
    HRESULT hr = pm->OnBeforeEnableProfileEx(list, minPort, maxPort, 2, VARIANT_FALSE);
    VariantClear(&list);
    if (FAILED(hr)) {
        return Failed(options, "OnBeforeEnableProfileEx", hr);
    }

    ComPtr<ILocalSipProxy> proxy;
    hr = session.Module().Create(CLSID_LocalSipProxy, IID_ILocalSipProxy, proxy.GetVoidAddressOf());
    if (SUCCEEDED(hr)) {
        BStr internalText(internal);
        hr = proxy->put_InternalAddress(internalText.Get());
    }
    if (SUCCEEDED(hr)) {
        hr = proxy->Start(pm, minPort, maxPort, VARIANT_FALSE);
    }
    if (FAILED(hr)) {
        pm->OnBeforeDisableProfile();
        return Failed(options, "Start", hr);
    }
    const auto status = proxy.As<ILocalSipProxyStatus>();
    BStr sender;
    BStr contact;
    BStr server;
    proxy->get_SenderEndpoint(sender.Out());
    if (status) {
        status->get_PublicContact(contact.Out());
        status->get_ServerEndpoint(server.Out());
    }
    if (options.Json()) {
        PrintJson(Json{{"sender_endpoint", sender.Utf8()},
                       {"public_contact", contact.Utf8()},
                       {"server", server.Utf8()}});
    } else {
        std::printf("sender endpoint: %s\npublic contact:  %s\nserver:          %s\n",
                    sender.Utf8().c_str(), contact.Utf8().c_str(), server.Utf8().c_str());
    }
    std::fflush(stdout);
    Progress("relaying; Ctrl-C ends");
    session.PumpFor(duration);

    proxy->Stop();
    pm->OnBeforeDisableProfile();
    uint64_t toServer = 0;
    uint64_t toClient = 0;
    uint64_t dropped = 0;
    if (status) {
        status->GetRelayCounts(&toServer, &toClient, &dropped);
    }
    if (options.Json()) {
        PrintJson(Json{{"to_server", toServer}, {"to_client", toClient}, {"dropped", dropped}});
    } else {
        std::printf("relayed to server: %llu\nrelayed to client: %llu\ndropped:           %llu\n",
                    static_cast<unsigned long long>(toServer),
                    static_cast<unsigned long long>(toClient),
                    static_cast<unsigned long long>(dropped));
    }
    return kExitOk;
}

}  // namespace nqpm
