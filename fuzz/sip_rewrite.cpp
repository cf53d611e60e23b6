// Both rewrites of the local SIP proxy over one datagram, the proxy's texts and the learned
// client drawn from the input as well.
#include <algorithm>

#include "fuzz/FuzzSupport.h"
#include "sipproxy/SipRewriter.h"
#include "sipproxy/SipText.h"

namespace {

bool Contains(const std::string& text, const std::string& part) {
    return !part.empty() && text.find(part) != std::string::npos;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::vector<std::string> f = fuzz::Fields(data, size, 10);
    // The texts are the proxy's own endpoints (at most 21 characters), not the peer's: longer
    // ones would only let each chained rewrite multiply the datagram's size.
    for (size_t i = 0; i + 1 < f.size(); ++i) {
        f[i].resize(std::min<size_t>(f[i].size(), 32));
    }
    sipproxy::SipProxyTexts texts;
    texts.m_internalAddress = f[0];
    texts.m_serverAddress = f[1];
    texts.m_serverPort = fuzz::Port(f[2]);
    texts.m_publicContact = f[3];
    texts.m_internalEndpoint = f[4];
    texts.m_mappingPublicAddress = f[5];
    texts.m_stopText = f[6];
    const sipproxy::ClientEndpoint client{f[7], fuzz::Port(f[8])};
    const std::string& message = f[9];

    sipproxy::SipRewriter rewriter;
    rewriter.SetTexts(texts);
    rewriter.SetClient(client);
    const std::string toServer = rewriter.RewriteFromClient(message);
    const std::string toClient = rewriter.RewriteFromServer(message, client);
    if (message == texts.m_stopText) {
        FUZZ_CHECK(toServer.empty() && toClient.empty());
        return 0;
    }

    // A message that holds none of the texts a rewrite looks for comes through unchanged.
    const std::string serverEndpoint =
        texts.m_serverAddress + ":" + std::to_string(texts.m_serverPort);
    if (!Contains(message, "Via: SIP/2.0/UDP " + texts.m_internalAddress + ":") &&
        !Contains(message,
                  texts.m_mappingPublicAddress + ":" + std::to_string(client.m_clientPort))) {
        FUZZ_CHECK(toServer == message);
    }
    if (!Contains(message, texts.m_publicContact) && !Contains(message, serverEndpoint) &&
        !Contains(message, texts.m_serverAddress + ";") &&
        !Contains(message, texts.m_serverAddress + "\r\n")) {
        FUZZ_CHECK(toClient == message);
    }
    FUZZ_CHECK(sipproxy::CorrectContentLength(message, message) == message);
    return 0;
}
