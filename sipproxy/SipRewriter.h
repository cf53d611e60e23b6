// The two rewrites of the local SIP proxy, free of sockets and threads: the proxy sets the texts
// before its relay threads start, and the threads call the rewrites on each datagram.
#pragma once

#include <cstdint>
#include <mutex>
#include <string>

namespace sipproxy {

// What the rewrites know of the proxy; set before the relay threads start, read-only while
// they run.
struct SipProxyTexts {
    std::string m_internalAddress;  // local address text of the internal socket; empty if closed
    std::string m_serverAddress;    // dotted quad
    int32_t m_serverPort = 0;
    std::string m_publicContact;         // public address ":" external socket's port
    std::string m_internalEndpoint;      // internal address ":" internal socket's port
    std::string m_mappingPublicAddress;  // public address of the client's SIP mapping
    std::string m_stopText = "STOP";
};

// The client's address as learned from its REGISTER requests.
struct ClientEndpoint {
    std::string m_clientAddress;
    int32_t m_clientPort = 0;
};

class SipRewriter {
  public:
    SipRewriter() = default;
    SipRewriter(const SipRewriter&) = delete;
    SipRewriter& operator=(const SipRewriter&) = delete;

    // Only while no relay thread runs.
    void SetTexts(SipProxyTexts texts) { m_texts = std::move(texts); }
    const SipProxyTexts& Texts() const { return m_texts; }

    // The text for the SIP server, or empty for the stop text. Learns the client from REGISTER.
    std::string RewriteFromClient(const std::string& message);
    // The text for the client, or empty for the stop text.
    std::string RewriteFromServer(const std::string& message, const ClientEndpoint& client) const;
    std::string RewriteFromServer(const std::string& message) const {
        return RewriteFromServer(message, Client());
    }

    // The sender thread learns the client, the receiver thread reads it: one lock keeps address
    // and port a consistent pair.
    ClientEndpoint Client() const;
    void SetClient(ClientEndpoint client);

  private:
    SipProxyTexts m_texts;
    mutable std::mutex m_clientMutex;
    ClientEndpoint m_client;
};

}  // namespace sipproxy
