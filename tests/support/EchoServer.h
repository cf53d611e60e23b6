// The diagnostic echo server as a test peer (no such server exists outside this project): a TCP
// login that answers the seven headers, UDP echo on five ports, and for every datagram a report
// over the control connection. Fault switches make it behave like a broken server or path.
#pragma once

#include <condition_variable>
#include <cstdint>
#include <map>
#include <mutex>
#include <string>
#include <vector>

#include "platform/kernel.h"
#include "platform/net.h"

namespace testsupport {

class EchoServer {
  public:
    enum class Fault {
        kNone,
        kNoReport,         // echo only
        kNoEcho,           // report only
        kNoReportNoEcho,   // silence
        kAlterInbound,     // the payload changed before the server saw it: report and echo
        kAlterReturn,      // the echo changed on the way back
        kCutEcho,          // the echo loses its last bytes
        kReportInTwo,      // the report in two TCP segments
        kReportInThree,    // the report in three TCP segments
        kLyingLength,      // Content-Length larger than the payload
        kMalformedReport,  // a length line without CR LF, and no payload
        kFloodedReport,    // a header so long that the payload cannot fit a 4096-byte buffer
    };

    struct Options {
        Fault fault = Fault::kNone;
        // The datagram (0 = the first the server gets) the fault applies to; -1: every one.
        int faultyDatagram = -1;
        std::string missingHeader;  // a login header left out, e.g. "Video-RTCP-Port"
        int status = 200;
        // Empty: " nq-session-NN", one per login. Set: every login gets exactly this value.
        std::string sessionId;
        int loginDelayMs = 0;  // before the login reply
    };

    EchoServer();
    explicit EchoServer(Options options);
    ~EchoServer();
    EchoServer(const EchoServer&) = delete;
    EchoServer& operator=(const EchoServer&) = delete;

    // Listens on address (host order), system-chosen ports. False when something failed.
    bool Start(uint32_t address = 0x7F000001);
    uint16_t Port() const { return controlPort_; }
    // Datagrams received so far, in order.
    std::vector<std::string> Datagrams() const;
    // Waits until no control connection is open (the client closed them all); false on timeout.
    bool WaitIdle(int timeoutMs) const;
    // Waits until a control connection was accepted; false on timeout.
    bool WaitConnected(int timeoutMs) const;

  private:
    struct Connection {
        platform::Socket socket;
        std::string received;
        std::string sessionId;
        bool loggedIn = false;
        uint64_t replyAtMs = 0;  // a login reply still to send at that time (0: none)
    };

    void Run();
    void OnControlData(Connection& c);
    void SendLoginReply(Connection& c);
    void OnDatagram(platform::SocketHandle s);
    void Report(platform::SocketHandle control, const std::string& payload, bool faulty);
    platform::SocketHandle ControlFor(const std::string& payload);

    Options options_;
    platform::Socket listener_;
    uint16_t controlPort_ = 0;
    platform::Socket udp_[5];
    uint16_t udpPorts_[5] = {};
    std::vector<Connection> connections_;  // the server thread's
    int logins_ = 0;
    platform::Thread thread_;

    mutable std::mutex mutex_;
    mutable std::condition_variable changed_;
    std::vector<std::string> datagrams_;
    int open_ = 0;
    int accepted_ = 0;
};

}  // namespace testsupport
