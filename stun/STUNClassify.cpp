#include "stun/STUNClassify.h"

#include "foundation/Logger.h"
#include "foundation/NetUtils.h"
#include "platform/kernel.h"
#include "stun/STUNTransaction.h"

namespace stun {

namespace {
constexpr const char* kGetResult = "STUN_GetResult";
constexpr const char* kTestServers = "STUN_TestServers";

// STUN_GetResult's error lines.
void LogGetResultError(const char* message) {
    NQ_LOG(kGetResult, foundation::kLogError, "%s", message);
}

// A plain or changing Binding Request from a new rotating port that is not reported.
bool RunTest(uint32_t local, uint32_t server, uint16_t port, bool changeIp, bool changePort,
             CSTUNMessage& response) {
    uint32_t from = 0;
    uint16_t fromPort = 0;
    return STUN_RunTest(local, nullptr, server, port, changeIp, changePort, response, from,
                        fromPort);
}
}  // namespace

void STUN_GetResult(uint32_t serverAddress, uint16_t serverPort, STUNResultEntry& entry) {
    const uint32_t local = entry.localAddress;
    entry.publicAddress = kNoPublicAddress;

    // Test 1: the mapping, from a rotating port that we learn.
    uint16_t test1Port = 0;
    CSTUNMessage test1;
    uint32_t from = 0;
    uint16_t fromPort = 0;
    if (!STUN_RunTest(local, &test1Port, serverAddress, serverPort, false, false, test1, from,
                      fromPort)) {
        entry.stunResult = STUN_RESULT_BLOCKED;
        return;
    }
    if (!test1.HasMandatoryAttributes()) {
        LogGetResultError("response on test 1 doesn't have the mandatory attributes");
        entry.stunResult = STUN_RESULT_UNKNOWN;
        return;
    }
    const uint32_t mapped = test1.m_mappedAddress.m_address;
    if (test1.m_mappedAddress.m_port != test1Port) {
        // Any port translation counts as symmetric.
        entry.stunResult = STUN_RESULT_SYMMETRIC_NAT;
        return;
    }

    CSTUNMessage test2;
    if (mapped == local) {
        // A static public address: only a firewall can be in the way.
        if (!RunTest(local, serverAddress, serverPort, true, true, test2)) {
            entry.stunResult = STUN_RESULT_SYMMETRIC_FIREWALL;
            entry.publicAddress = mapped;
            return;
        }
        if (!test2.HasMandatoryAttributes()) {
            LogGetResultError(
                "response on test 2 (the case with static public IP) doesn't have the mandatory "
                "attributes!!!");
            entry.stunResult = STUN_RESULT_UNKNOWN;
            return;
        }
        entry.publicAddress = mapped;
        entry.stunResult = STUN_RunResponseAddressTest(local, serverAddress, serverPort, mapped)
                               ? STUN_RESULT_OPEN
                               : STUN_RESULT_FULL_CONE_FIREWALL;
        return;
    }

    if (RunTest(local, serverAddress, serverPort, true, true, test2)) {
        if (!test2.HasMandatoryAttributes()) {
            LogGetResultError(
                "response on test 2 (the case without static public IP) doesn't have the "
                "mandatory attributes");
            entry.stunResult = STUN_RESULT_UNKNOWN;
            return;
        }
        entry.stunResult = STUN_RESULT_FULL_CONE_NAT;
        entry.publicAddress = mapped;
        return;
    }

    // Test 1_1: the other server address on the given port (not CHANGED-ADDRESS's port).
    CSTUNMessage test11;
    if (!RunTest(local, test1.m_changedAddress.m_address, serverPort, false, false, test11)) {
        entry.stunResult = STUN_RESULT_BLOCKED;
        return;
    }
    if (!test11.HasMandatoryAttributes()) {
        LogGetResultError("response on test 1_1 doesn't have the mandatory attributes");
        entry.stunResult = STUN_RESULT_UNKNOWN;
        return;
    }
    if (test11.m_mappedAddress.m_address != mapped) {
        entry.stunResult = STUN_RESULT_SYMMETRIC_NAT;
        return;
    }

    // Test 3: change port only.
    CSTUNMessage test3;
    entry.stunResult = RunTest(local, serverAddress, serverPort, false, true, test3)
                           ? STUN_RESULT_RESTRICTED_CONE_NAT
                           : STUN_RESULT_PORT_RESTRICTED_CONE_NAT;
    entry.publicAddress = mapped;
}

bool ResolveSTUNServer(const char* name, bool logErrors, uint32_t& hostAddress) {
    if (name == nullptr) {
        return false;
    }
    uint32_t net = 0;
    if (logErrors) {
        // Logs a resolver failure other than an unknown name under its own name.
        net = foundation::GetIPByName(name);
    } else {
        net = platform::InetAddrNet(name);
        if (net == platform::kInaddrNone && platform::ResolveHostNameNet(name, &net) != 0) {
            return false;
        }
    }
    if (net == 0) {
        return false;
    }
    hostAddress = platform::NetToHost32(net);
    return true;
}

int32_t STUN_TestServers(uint32_t localAddress, const char* servers) {
    if (servers == nullptr) {
        NQ_LOG(kTestServers, foundation::kLogError, "%s", "Failed Assertion - szCSServers != NULL");
        return -1;
    }
    NQ_TRACE_ENTERED(kTestServers);
    char token[kServerTokenSize];
    for (int32_t index = 0;; ++index) {
        GetListToken(servers, index, token, sizeof token);
        if (token[0] == '\0' || platform::CurrentThreadStopRequested()) {
            return -1;
        }
        uint32_t server = 0;
        if (ResolveSTUNServer(token, false, server)) {
            CSTUNMessage response;
            uint32_t from = 0;
            uint16_t fromPort = 0;
            if (STUN_RunTest(localAddress, nullptr, server, kSTUNPort, false, false, response, from,
                             fromPort)) {
                NQ_LOG(kTestServers, foundation::kLogInfo, "%s", "STUN_RunTest() succeeded");
                return index;
            }
        }
        NQ_LOG(kTestServers, foundation::kLogError, "%s", "STUN_RunTest() failed");
    }
}

}  // namespace stun
