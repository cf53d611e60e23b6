#include "tests/support/FakeStunServer.h"

#include <chrono>
#include <utility>

#include "tests/support/StunBytes.h"

namespace testsupport {

namespace {

constexpr size_t kHeader = 20;
constexpr uint16_t kBindingResponse = 0x0101;

uint16_t Read16(const uint8_t* p) {
    return static_cast<uint16_t>((p[0] << 8) | p[1]);
}

uint32_t Read32(const uint8_t* p) {
    return (static_cast<uint32_t>(p[0]) << 24) | (static_cast<uint32_t>(p[1]) << 16) |
           (static_cast<uint32_t>(p[2]) << 8) | p[3];
}

// The RESPONSE-ADDRESS of a request, parsed independently of the code under test.
std::optional<std::pair<uint32_t, uint16_t>> FindResponseAddress(const std::vector<uint8_t>& r) {
    size_t offset = kHeader;
    while (offset + 4 <= r.size()) {
        const uint16_t type = Read16(&r[offset]);
        const uint16_t length = Read16(&r[offset + 2]);
        if (type == 0x0002 && length >= 8 && offset + 12 <= r.size()) {
            return std::make_pair(Read32(&r[offset + 8]), Read16(&r[offset + 6]));
        }
        offset += 4 + length;
    }
    return std::nullopt;
}

}  // namespace

FakeStunServer::FakeStunServer(uint32_t address, uint16_t port) : address_(address) {
    socket_ = platform::OpenUdpSocket();
    if (!socket_ || !platform::BindSocket(socket_.Get(), address, port) ||
        !platform::GetSocketName(socket_.Get(), nullptr, &port_)) {
        socket_.Close();
        return;
    }
    running_ = thread_.Start([this] { Run(); });
}

FakeStunServer::~FakeStunServer() {
    // The thread's wait ends on the stop request; only then may the sockets go.
    thread_.Stop();
}

void FakeStunServer::SetMode(Mode mode) {
    std::lock_guard<std::mutex> lock(mutex_);
    mode_ = mode;
}

void FakeStunServer::SetMappedPort(std::optional<uint16_t> port) {
    std::lock_guard<std::mutex> lock(mutex_);
    mappedPort_ = port;
}

int FakeStunServer::RequestCount() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return requests_;
}

bool FakeStunServer::WaitForRequests(int count, int timeoutMs) const {
    std::unique_lock<std::mutex> lock(mutex_);
    return arrived_.wait_for(lock, std::chrono::milliseconds(timeoutMs),
                             [&] { return requests_ >= count; });
}

void FakeStunServer::Run() {
    uint8_t buffer[2048];
    while (!platform::CurrentThreadStopRequested()) {
        // Without a time limit: the owner's stop request ends the wait.
        const int ready = platform::WaitSocketReadable(socket_.Get(), -1);
        if (ready != 1) {
            continue;
        }
        uint32_t fromAddress = 0;
        uint16_t fromPort = 0;
        const int n =
            platform::ReceiveFrom(socket_.Get(), buffer, sizeof buffer, &fromAddress, &fromPort);
        if (n < 0) {
            continue;
        }
        {
            std::lock_guard<std::mutex> lock(mutex_);
            ++requests_;
        }
        arrived_.notify_all();
        Answer(std::vector<uint8_t>(buffer, buffer + n), fromAddress, fromPort);
    }
}

void FakeStunServer::Answer(const std::vector<uint8_t>& request, uint32_t fromAddress,
                            uint16_t fromPort) {
    std::lock_guard<std::mutex> lock(mutex_);
    if (mode_ == Mode::kSilent || request.size() < kHeader) {
        return;
    }
    const auto responseAddress = FindResponseAddress(request);
    std::vector<uint8_t> out;
    out.reserve(64);  // also keeps GCC 12 from a false overflow warning on the insert below
    Put16(out, kBindingResponse);
    Put16(out, 0);  // patched below
    out.insert(out.end(), request.begin() + 4, request.begin() + 20);
    PutAddress(out, 0x0001, fromAddress, mappedPort_.value_or(fromPort));
    PutAddress(out, 0x0004, address_, port_);
    if (mode_ != Mode::kNoChangedAddress) {
        PutAddress(out, 0x0005, address_, port_);
    }
    if (responseAddress) {
        PutAddress(out, 0x000B, fromAddress, fromPort);
    }
    const size_t length = out.size() - kHeader;
    out[2] = static_cast<uint8_t>(length >> 8);
    out[3] = static_cast<uint8_t>(length);
    platform::SendTo(socket_.Get(), out.data(), out.size(),
                     responseAddress ? responseAddress->first : fromAddress,
                     responseAddress ? responseAddress->second : fromPort);
}

}  // namespace testsupport
