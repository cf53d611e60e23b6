#include "tests/support/EchoServer.h"

#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>

#include <algorithm>
#include <chrono>
#include <cstring>

namespace testsupport {

namespace {

constexpr const char* kPortHeaders[] = {"SIP-Port", "Audio-RTP-Port", "Audio-RTCP-Port",
                                        "Video-RTP-Port", "Video-RTCP-Port"};

void SendAll(platform::SocketHandle s, const std::string& bytes) {
    size_t at = 0;
    while (at < bytes.size()) {
        const ssize_t n = send(s, bytes.data() + at, bytes.size() - at, MSG_NOSIGNAL);
        if (n <= 0) {
            return;
        }
        at += static_cast<size_t>(n);
    }
}

std::string Altered(std::string bytes) {
    if (!bytes.empty()) {
        char& c = bytes[bytes.size() / 2];
        c = c == 'X' ? 'Y' : 'X';
    }
    return bytes;
}

}  // namespace

EchoServer::EchoServer() = default;
EchoServer::EchoServer(Options options) : options_(std::move(options)) {}

EchoServer::~EchoServer() {
    thread_.Stop();
}

bool EchoServer::Start(uint32_t address) {
    listener_ = platform::OpenTcpSocket();
    if (!listener_.IsValid() || !platform::SetReuseAddress(listener_.Get(), true) ||
        !platform::BindSocket(listener_.Get(), address, 0) || listen(listener_.Get(), 8) != 0 ||
        !platform::GetSocketName(listener_.Get(), nullptr, &controlPort_)) {
        return false;
    }
    for (int i = 0; i < 5; ++i) {
        udp_[i] = platform::OpenUdpSocket();
        if (!udp_[i].IsValid() || !platform::BindSocket(udp_[i].Get(), address, 0) ||
            !platform::GetSocketName(udp_[i].Get(), nullptr, &udpPorts_[i])) {
            return false;
        }
    }
    return thread_.Start([this] { Run(); });
}

std::vector<std::string> EchoServer::Datagrams() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return datagrams_;
}

bool EchoServer::WaitIdle(int timeoutMs) const {
    std::unique_lock<std::mutex> lock(mutex_);
    return changed_.wait_for(lock, std::chrono::milliseconds(timeoutMs),
                             [this] { return open_ == 0; });
}

bool EchoServer::WaitConnected(int timeoutMs) const {
    std::unique_lock<std::mutex> lock(mutex_);
    return changed_.wait_for(lock, std::chrono::milliseconds(timeoutMs),
                             [this] { return accepted_ > 0; });
}

void EchoServer::Run() {
    const int stop = platform::CurrentStopSource()->Descriptor();
    for (;;) {
        std::vector<pollfd> fds;
        fds.push_back({stop, POLLIN, 0});
        fds.push_back({listener_.Get(), POLLIN, 0});
        for (auto& u : udp_) {
            fds.push_back({u.Get(), POLLIN, 0});
        }
        for (auto& c : connections_) {
            fds.push_back({c.socket.Get(), POLLIN, 0});
        }
        // Slow logins are answered from here, so the server goes on serving meanwhile.
        int wait = -1;
        const uint64_t now = platform::GetTickCount64();
        for (auto& c : connections_) {
            if (c.replyAtMs != 0) {
                const int left = c.replyAtMs > now ? static_cast<int>(c.replyAtMs - now) : 0;
                wait = wait < 0 ? left : std::min(wait, left);
            }
        }
        if (poll(fds.data(), fds.size(), wait) < 0) {
            continue;
        }
        for (auto& c : connections_) {
            if (c.replyAtMs != 0 && c.replyAtMs <= platform::GetTickCount64() &&
                c.socket.IsValid()) {
                c.replyAtMs = 0;
                SendLoginReply(c);
            }
        }
        if (fds[0].revents != 0) {
            return;
        }
        if (fds[1].revents != 0) {
            const int s = accept4(listener_.Get(), nullptr, nullptr, SOCK_CLOEXEC);
            if (s >= 0) {
                connections_.push_back(Connection{platform::Socket(s), {}, {}, false});
                std::lock_guard<std::mutex> lock(mutex_);
                ++open_;
                ++accepted_;
                changed_.notify_all();
            }
            continue;  // the vector moved: poll again
        }
        for (int i = 0; i < 5; ++i) {
            if (fds[2 + i].revents != 0) {
                OnDatagram(udp_[i].Get());
            }
        }
        for (size_t i = 0; i < connections_.size(); ++i) {
            if (fds[7 + i].revents != 0) {
                OnControlData(connections_[i]);
            }
        }
        const size_t before = connections_.size();
        std::erase_if(connections_, [](const Connection& c) { return !c.socket.IsValid(); });
        if (connections_.size() != before) {
            std::lock_guard<std::mutex> lock(mutex_);
            open_ -= static_cast<int>(before - connections_.size());
            changed_.notify_all();
        }
    }
}

void EchoServer::OnControlData(Connection& c) {
    char buffer[2048];
    const ssize_t n = recv(c.socket.Get(), buffer, sizeof buffer, 0);
    if (n <= 0) {
        c.socket.Close();
        return;
    }
    c.received.append(buffer, static_cast<size_t>(n));
    if (c.loggedIn || c.received.find("SIP-Mode: Echo\r\n") == std::string::npos) {
        return;
    }
    c.loggedIn = true;
    ++logins_;
    char number[16];
    std::snprintf(number, sizeof number, "%02d", logins_);
    c.sessionId =
        options_.sessionId.empty() ? " nq-session-" + std::string(number) : options_.sessionId;
    if (options_.loginDelayMs > 0) {
        c.replyAtMs = platform::GetTickCount64() + static_cast<uint64_t>(options_.loginDelayMs);
        return;
    }
    SendLoginReply(c);
}

void EchoServer::SendLoginReply(Connection& c) {
    std::string reply;
    auto add = [&](const std::string& name, const std::string& value) {
        if (name != options_.missingHeader) {
            reply += name + ":" + value + "\r\n";
        }
    };
    add("Status", " " + std::to_string(options_.status));
    for (int i = 0; i < 5; ++i) {
        add(kPortHeaders[i], " " + std::to_string(udpPorts_[i]));
    }
    // Last, so that an id longer than the client's buffer still leaves the ports readable.
    add("Session-Id", c.sessionId);
    SendAll(c.socket.Get(), reply);
}

platform::SocketHandle EchoServer::ControlFor(const std::string& payload) {
    platform::SocketHandle latest = platform::kInvalidSocket;
    for (auto& c : connections_) {
        if (!c.loggedIn || !c.socket.IsValid()) {
            continue;
        }
        if (payload.find(c.sessionId) != std::string::npos) {
            return c.socket.Get();
        }
        latest = c.socket.Get();
    }
    return latest;
}

void EchoServer::OnDatagram(platform::SocketHandle s) {
    char buffer[65536];
    sockaddr_in from{};
    socklen_t fromLength = sizeof from;
    const ssize_t n =
        recvfrom(s, buffer, sizeof buffer, 0, reinterpret_cast<sockaddr*>(&from), &fromLength);
    if (n < 0) {
        return;
    }
    const std::string payload(buffer, static_cast<size_t>(n));
    int index = 0;
    {
        std::lock_guard<std::mutex> lock(mutex_);
        index = static_cast<int>(datagrams_.size());
        datagrams_.push_back(payload);
    }
    const bool faulty = options_.faultyDatagram < 0 || options_.faultyDatagram == index;
    const Fault fault = faulty ? options_.fault : Fault::kNone;
    const std::string inbound = fault == Fault::kAlterInbound ? Altered(payload) : payload;
    if (fault != Fault::kNoEcho && fault != Fault::kNoReportNoEcho) {
        std::string echo = inbound;
        if (fault == Fault::kAlterReturn) {
            echo = Altered(echo);
        } else if (fault == Fault::kCutEcho) {
            echo.resize(echo.size() > 10 ? echo.size() - 10 : 0);
        }
        sendto(s, echo.data(), echo.size(), MSG_NOSIGNAL, reinterpret_cast<sockaddr*>(&from),
               fromLength);
    }
    if (fault != Fault::kNoReport && fault != Fault::kNoReportNoEcho) {
        Report(ControlFor(payload), inbound, faulty);
    }
}

void EchoServer::Report(platform::SocketHandle control, const std::string& payload, bool faulty) {
    if (control == platform::kInvalidSocket) {
        return;
    }
    const Fault fault = faulty ? options_.fault : Fault::kNone;
    std::string header = "Method: Echo\r\n";
    if (fault == Fault::kFloodedReport) {
        header += "X-Padding: " + std::string(4000, 'p') + "\r\n";
    }
    const size_t length = payload.size() + (fault == Fault::kLyingLength ? 7 : 0);
    if (fault == Fault::kMalformedReport) {
        // The length line never ends (the payload would bring its own CR LFs).
        SendAll(control, header + "Content-Length: " + std::to_string(length));
        return;
    }
    header += "Content-Length: " + std::to_string(length) + "\r\n\r\n";
    const int parts = fault == Fault::kReportInTwo ? 2 : fault == Fault::kReportInThree ? 3 : 1;
    // Far enough apart that the client reads each segment alone.
    const int gapMs = parts == 3 ? 200 : 50;
    const size_t step = payload.size() / static_cast<size_t>(parts);
    SendAll(control, header + payload.substr(0, parts == 1 ? payload.size() : step));
    for (int part = 1; part < parts; ++part) {
        if (platform::Sleep(gapMs) != platform::WaitResult::Timeout) {
            return;
        }
        const size_t at = step * static_cast<size_t>(part);
        SendAll(control, payload.substr(at, part == parts - 1 ? std::string::npos : step));
    }
}

}  // namespace testsupport
