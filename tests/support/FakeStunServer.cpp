#include "tests/support/FakeStunServer.h"

#include <algorithm>
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
    answerAddress_ = address_;
    answerPort_ = port_;
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

void FakeStunServer::SetRawAnswer(std::vector<uint8_t> bytes, bool copyTransactionId) {
    std::lock_guard<std::mutex> lock(mutex_);
    raw_ = std::move(bytes);
    copyTransactionId_ = copyTransactionId;
    mode_ = Mode::kRaw;
}

void FakeStunServer::SetMappedPort(std::optional<uint16_t> port) {
    std::lock_guard<std::mutex> lock(mutex_);
    mappedPort_ = port;
}

void FakeStunServer::SetSourceAddress(uint32_t address, uint16_t port) {
    std::lock_guard<std::mutex> lock(mutex_);
    source_ = std::make_pair(address, port);
}

void FakeStunServer::SetChangedAddress(uint32_t address, uint16_t port) {
    std::lock_guard<std::mutex> lock(mutex_);
    changed_ = std::make_pair(address, port);
}

bool FakeStunServer::AnswerFrom(uint32_t address, uint16_t port) {
    platform::Socket s = platform::OpenUdpSocket();
    uint16_t bound = 0;
    if (!s || !platform::BindSocket(s.Get(), address, port) ||
        !platform::GetSocketName(s.Get(), nullptr, &bound)) {
        return false;
    }
    std::lock_guard<std::mutex> lock(mutex_);
    answerSocket_ = std::move(s);
    answerAddress_ = address;
    answerPort_ = bound;
    return true;
}

uint32_t FakeStunServer::AnswerAddress() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return answerAddress_;
}

uint16_t FakeStunServer::AnswerPort() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return answerPort_;
}

int FakeStunServer::RequestCount() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return static_cast<int>(requests_.size());
}

bool FakeStunServer::WaitForRequests(int count, int timeoutMs) const {
    std::unique_lock<std::mutex> lock(mutex_);
    return arrived_.wait_for(lock, std::chrono::milliseconds(timeoutMs),
                             [&] { return static_cast<int>(requests_.size()) >= count; });
}

std::vector<FakeStunServer::Request> FakeStunServer::Requests() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return requests_;
}

FakeStunServer::Request FakeStunServer::LastRequest() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return requests_.empty() ? Request{} : requests_.back();
}

void FakeStunServer::Run() {
    uint8_t buffer[2048];
    while (!platform::CurrentThreadStopRequested()) {
        // Without a time limit: the owner's stop request ends the wait.
        const int ready = platform::WaitSocketReadable(socket_.Get(), -1);
        if (ready != 1) {
            continue;
        }
        Request request;
        const int n = platform::ReceiveFrom(socket_.Get(), buffer, sizeof buffer,
                                            &request.fromAddress, &request.fromPort);
        if (n < 0) {
            continue;
        }
        request.bytes.assign(buffer, buffer + n);
        request.tickMs = platform::GetTickCount64();
        {
            std::lock_guard<std::mutex> lock(mutex_);
            requests_.push_back(request);
        }
        arrived_.notify_all();
        Answer(request);
    }
}

void FakeStunServer::Answer(const Request& request) {
    std::lock_guard<std::mutex> lock(mutex_);
    if (mode_ == Mode::kSilent || request.bytes.size() < kHeader) {
        return;
    }
    const auto responseAddress = FindResponseAddress(request.bytes);
    const uint32_t toAddress = responseAddress ? responseAddress->first : request.fromAddress;
    const uint16_t toPort = responseAddress ? responseAddress->second : request.fromPort;
    const platform::SocketHandle out = answerSocket_ ? answerSocket_.Get() : socket_.Get();

    std::vector<uint8_t> answer;
    if (mode_ == Mode::kRaw) {
        answer = raw_;
        if (copyTransactionId_ && answer.size() >= kHeader) {
            std::copy(request.bytes.begin() + 4, request.bytes.begin() + 20, answer.begin() + 4);
        }
    } else {
        uint8_t id[16];
        std::copy(request.bytes.begin() + 4, request.bytes.begin() + 20, id);
        if (mode_ == Mode::kWrongTransactionId) {
            for (uint8_t& b : id) {
                b = static_cast<uint8_t>(~b);
            }
        }
        answer =
            BuildResponse(request, id, answerAddress_, answerPort_, responseAddress.has_value());
    }
    platform::SendTo(out, answer.data(), answer.size(), toAddress, toPort);
}

std::vector<uint8_t> FakeStunServer::BuildResponse(const Request& request,
                                                   const uint8_t* transactionId,
                                                   uint32_t fromAddress, uint16_t fromPort,
                                                   bool reflected) const {
    std::vector<uint8_t> out;
    out.reserve(64);  // also keeps GCC 12 from a false overflow warning on the insert below
    Put16(out, kBindingResponse);
    Put16(out, 0);  // patched below
    out.insert(out.end(), transactionId, transactionId + 16);
    PutAddress(out, 0x0001, request.fromAddress, mappedPort_.value_or(request.fromPort));
    const auto source = source_.value_or(std::make_pair(fromAddress, fromPort));
    PutAddress(out, 0x0004, source.first, source.second);
    if (mode_ != Mode::kNoChangedAddress) {
        const auto changed = changed_.value_or(std::make_pair(address_, port_));
        PutAddress(out, 0x0005, changed.first, changed.second);
    }
    if (reflected) {
        PutAddress(out, 0x000B, request.fromAddress, request.fromPort);
    }
    const size_t length = out.size() - kHeader;
    out[2] = static_cast<uint8_t>(length >> 8);
    out[3] = static_cast<uint8_t>(length);
    return out;
}

}  // namespace testsupport
