// nqpm classify: the NAT type in front of a local address, as the port manager learns it.
#include <cstdio>

#include "foundation/NetUtils.h"
#include "platform/message.h"
#include "stun/STUNClassify.h"
#include "stun/STUNResult.h"
#include "stun/STUNResults.h"
#include "tools/nqpm/Cli.h"
#include "tools/nqpm/Commands.h"

namespace nqpm {

namespace {

const char* const kUsage =
    "usage: nqpm classify --stun LIST [--local A.B.C.D] [--json]\n"
    "Classifies the path to the Internet with the classic STUN tests (RFC 3489) against the\n"
    "first answering server of LIST (comma-separated host names or dotted quads, port 3478):\n"
    "from the given local address, or without --local from every usable local address (the\n"
    "first address of each interface with a default gateway), as the port manager does. Takes\n"
    "up to about 20 s per address. Exit 0 whenever a result was obtained.\n";

constexpr platform::UINT kPassEnded = platform::WM_USER + 1;

// Receives the service's message on this thread.
class PassWindow final : public platform::MessageWindow {
  public:
    platform::LRESULT WindowProc(platform::UINT message, platform::WPARAM, platform::LPARAM,
                                 bool& handled) override {
        handled = message == kPassEnded;
        ended = ended || handled;
        return 0;
    }
    bool ended = false;
};

// One pass of the result service over every usable local address.
bool ClassifyAll(const std::string& servers, stun::STUNResultList& list) {
    RouteInterrupts();
    PassWindow window;
    if (!window.CreateMessageWindow()) {
        return false;
    }
    stun::CSTUNResult service(servers.c_str(), window.Handle(), kPassEnded, 0);
    if (FAILED(service.Refresh())) {
        std::fprintf(stderr, "nqpm classify: the STUN service did not start\n");
        return false;
    }
    platform::RunMessageLoopUntil([&] { return window.ended; }, -1);
    const bool ok = window.ended && service.GetSTUNResult(&list);
    service.Stop();
    return ok;
}

}  // namespace

Json ClassificationJson(const stun::STUNResultList& list) {
    Json results = Json::array();
    for (int32_t i = 0; i < list.count && i < static_cast<int32_t>(stun::kMaxSTUNResults); ++i) {
        const auto& e = list.entries[i];
        const char* name = stun::STUNResultName(e.stunResult);
        Json o;
        o["local"] = stun::FormatHostOrderAddress(e.localAddress);
        o["result"] = name != nullptr ? name : "invalid";
        o["code"] = static_cast<int64_t>(e.stunResult);
        o["public"] = e.publicAddress == stun::kNoPublicAddress
                          ? Json(nullptr)
                          : Json(stun::FormatHostOrderAddress(e.publicAddress));
        results.push_back(std::move(o));
    }
    Json top;
    top["results"] = std::move(results);
    top["text"] = stun::FormatSTUNResults(list);
    return top;
}

int RunClassify(int argc, char** argv) {
    Options options("classify", {{"stun", true}, {"local", true}}, kUsage);
    options.Parse(argc, argv);
    if (options.WantsHelp()) {
        std::fputs(kUsage, stdout);
        return kExitOk;
    }
    const std::string servers = options.Required("stun");
    const bool oneAddress = options.Has("local");
    const uint32_t local = oneAddress ? ParseDottedQuad("local", options.Value("local")) : 0;
    ConfigureLogging(options);

    stun::STUNResultList list;
    if (!oneAddress) {
        Progress("classifying every usable local address (up to about 20 s each)");
        if (!ClassifyAll(servers, list)) {
            return kExitFailed;
        }
        if (options.Json()) {
            PrintJson(ClassificationJson(list));
        } else {
            std::printf("%s\n", stun::FormatSTUNResults(list).c_str());
        }
        return kExitOk;
    }

    Progress("looking for an answering STUN server");
    int32_t index = stun::STUN_TestServers(local, servers.c_str());
    if (index < 0) {
        index = 0;  // no server answered: classify against the first, which ends as blocked
    }
    char token[stun::kServerTokenSize];
    stun::GetListToken(servers.c_str(), index, token, sizeof token);
    uint32_t server = 0;
    if (!stun::ResolveSTUNServer(token, true, server)) {
        std::fprintf(stderr, "nqpm classify: cannot resolve STUN server '%s'\n", token);
        return kExitFailed;
    }
    Progress(std::string("classifying against ") + token + " (up to about 20 s)");
    list.count = 1;
    list.entries[0].localAddress = local;
    stun::STUN_GetResult(server, stun::kSTUNPort, list.entries[0]);

    if (options.Json()) {
        PrintJson(ClassificationJson(list));
    } else {
        std::printf("%s\n", stun::FormatSTUNResults(list).c_str());
    }
    return kExitOk;
}

}  // namespace nqpm
