#include "sipproxy/SipRewriter.h"

#include "sipproxy/SipText.h"

namespace sipproxy {

namespace {
constexpr const char* kViaStart = "Via: SIP/2.0/UDP ";
constexpr size_t kViaStartLength = 17;
constexpr const char* kContact = "Contact: ";
constexpr size_t kStatusDigit = 8;  // "SIP/2.0 200": the first digit of the status code

std::string Endpoint(const std::string& address, int32_t port) {
    return address + ":" + std::to_string(port);
}
}  // namespace

ClientEndpoint SipRewriter::Client() const {
    std::lock_guard<std::mutex> lock(m_clientMutex);
    return m_client;
}

void SipRewriter::SetClient(ClientEndpoint client) {
    std::lock_guard<std::mutex> lock(m_clientMutex);
    m_client = std::move(client);
}

std::string SipRewriter::RewriteFromClient(const std::string& message) {
    if (message == m_texts.m_stopText) {
        return {};
    }
    const bool response = message.size() > kStatusDigit && message[kStatusDigit] >= '1' &&
                          message[kStatusDigit] <= '9';
    std::string work = message;
    const std::string viaPrefix = kViaStart + m_texts.m_internalAddress + ":";
    const size_t via = message.find(viaPrefix);
    if (via != std::string::npos) {
        // The sent-by: the client's own address and port, up to its parameters or line end.
        const size_t begin = via + kViaStartLength;
        size_t end = message.find_first_of(";\r", via + viaPrefix.size());
        if (end == std::string::npos) {
            end = message.size();
        }
        const std::string sentBy = message.substr(begin, end - begin);
        if (!response) {
            if (IsRegister(message)) {
                const HostPort client = SplitHostPort(sentBy);
                SetClient(ClientEndpoint{client.host, client.port});
            }
            work = ReplaceAll(message, sentBy, m_texts.m_publicContact);
        } else {
            work = ReplaceAll(message, sentBy,
                              Endpoint(m_texts.m_serverAddress, m_texts.m_serverPort));
            const size_t contact = work.find(kContact);
            if (contact != std::string::npos) {
                size_t lineEnd = work.find("\r\n", contact + 1);
                if (lineEnd == std::string::npos) {
                    lineEnd = work.size();
                }
                const std::string line = work.substr(contact, lineEnd - contact);
                work = ReplaceAll(work, line, "Contact: <sip:" + m_texts.m_publicContact + ">");
            }
        }
    }
    const std::string clientPublic =
        Endpoint(m_texts.m_mappingPublicAddress, Client().m_clientPort);
    work = ReplaceInHeaders(work, clientPublic, m_texts.m_publicContact);
    return CorrectContentLength(message, work);
}

std::string SipRewriter::RewriteFromServer(const std::string& message,
                                           const ClientEndpoint& client) const {
    if (message == m_texts.m_stopText) {
        return {};
    }
    const std::string serverEndpoint = Endpoint(m_texts.m_serverAddress, m_texts.m_serverPort);
    std::string work = ReplaceInHeaders(message, m_texts.m_publicContact,
                                        Endpoint(client.m_clientAddress, client.m_clientPort));
    work = ReplaceInHeaders(work, serverEndpoint, m_texts.m_internalEndpoint);
    // The server's address where it stands without a port (a Via, a Record-Route).
    const size_t end = work.find(kHeaderEnd);
    std::string headers = end == std::string::npos ? work : work.substr(0, end);
    const std::string body = end == std::string::npos ? std::string() : work.substr(end);
    headers =
        ReplaceBareHost(headers, m_texts.m_serverAddress + ";", m_texts.m_internalEndpoint + ";");
    headers = ReplaceBareHost(headers, m_texts.m_serverAddress + "\r\n",
                              m_texts.m_internalEndpoint + "\r\n");
    return headers + body;
}

}  // namespace sipproxy
