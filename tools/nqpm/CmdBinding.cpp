// nqpm binding: one STUN Binding transaction, printing what the server saw.
#include <cstdio>
#include <optional>

#include "foundation/NetUtils.h"
#include "stun/STUNResults.h"
#include "stun/STUNTransaction.h"
#include "tools/nqpm/Cli.h"
#include "tools/nqpm/Commands.h"

namespace nqpm {

namespace {

const char* const kUsage =
    "usage: nqpm binding --stun HOST[:PORT] [--local A.B.C.D] [--change-ip] [--change-port] "
    "[--json]\n"
    "Sends one classic STUN Binding Request (retransmitted for up to 4.7 s) from a rotating local\n"
    "port and prints the local port and the MAPPED, SOURCE, CHANGED and REFLECTED-FROM addresses\n"
    "of the answer. Exit 1 when no answer came. The default server port is 3478.\n";

std::optional<std::string> AddressText(const stun::STUNAddressAttribute& a, uint16_t type) {
    if (a.m_type != type) {
        return std::nullopt;
    }
    return stun::FormatHostOrderAddress(a.m_address) + ":" + std::to_string(a.m_port);
}

}  // namespace

int RunBinding(int argc, char** argv) {
    Options options("binding",
                    {{"stun", true}, {"local", true}, {"change-ip", false}, {"change-port", false}},
                    kUsage);
    options.Parse(argc, argv);
    if (options.WantsHelp()) {
        std::fputs(kUsage, stdout);
        return kExitOk;
    }
    const HostPort server = ParseHostPort("stun", options.Required("stun"), 3478);
    const uint32_t local =
        options.Has("local") ? ParseDottedQuad("local", options.Value("local")) : 0;
    ConfigureLogging(options);

    const uint32_t serverNet = foundation::GetIPByName(server.host, foundation::kAddressNone);
    if (serverNet == foundation::kAddressNone || serverNet == 0) {
        std::fprintf(stderr, "nqpm binding: cannot resolve '%s'\n", server.host.c_str());
        return kExitFailed;
    }
    const uint32_t serverAddress = platform::NetToHost32(serverNet);

    Progress("waiting for an answer from " + server.host + " (up to 4.7 s)");
    uint16_t localPort = 0;
    stun::CSTUNMessage response;
    uint32_t from = 0;
    uint16_t fromPort = 0;
    const bool answered =
        stun::STUN_RunTest(local, &localPort, serverAddress, server.port, options.Has("change-ip"),
                           options.Has("change-port"), response, from, fromPort);
    const auto mapped = AddressText(response.m_mappedAddress, stun::STUN_MAPPED_ADDRESS);
    const auto source = AddressText(response.m_sourceAddress, stun::STUN_SOURCE_ADDRESS);
    const auto changed = AddressText(response.m_changedAddress, stun::STUN_CHANGED_ADDRESS);
    const auto reflected = AddressText(response.m_reflectedFrom, stun::STUN_REFLECTED_FROM);

    if (options.Json()) {
        Json o;
        o["local_port"] = localPort;
        o["mapped"] = answered ? OptionalText(mapped) : nullptr;
        o["source"] = answered ? OptionalText(source) : nullptr;
        o["changed"] = answered ? OptionalText(changed) : nullptr;
        o["reflected"] = answered ? OptionalText(reflected) : nullptr;
        o["from"] = answered
                        ? Json(stun::FormatHostOrderAddress(from) + ":" + std::to_string(fromPort))
                        : Json(nullptr);
        PrintJson(o);
    } else if (answered) {
        const auto show = [](const std::optional<std::string>& v) {
            return v ? v->c_str() : "(absent)";
        };
        std::printf("local port:     %u\n", localPort);
        std::printf("answered from:  %s:%u\n", stun::FormatHostOrderAddress(from).c_str(),
                    fromPort);
        std::printf("MAPPED-ADDRESS: %s\n", show(mapped));
        std::printf("SOURCE-ADDRESS: %s\n", show(source));
        std::printf("CHANGED-ADDRESS: %s\n", show(changed));
        std::printf("REFLECTED-FROM: %s\n", show(reflected));
    } else {
        std::printf("local port:     %u\nno answer from %s:%u\n", localPort, server.host.c_str(),
                    server.port);
    }
    return answered ? kExitOk : kExitFailed;
}

}  // namespace nqpm
