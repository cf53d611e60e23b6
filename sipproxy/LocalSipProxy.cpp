#include "sipproxy/LocalSipProxy.h"

#include <new>

#include "foundation/Logger.h"
#include "foundation/NetUtils.h"
#include "portmanager/BstrOut.h"
#include "sipproxy/SipText.h"

namespace sipproxy {

namespace {
constexpr const char* kSender = "CLocalSipProxy::SenderServiceProc";
constexpr const char* kReceiver = "CLocalSipProxy::ReceiverServiceProc";
constexpr const char* kSendFailed = "Send(%s, %d) failed";
}  // namespace

HRESULT CLocalSipProxy::CreateInstance(REFIID riid, void** ppv, ITypeLib* library) {
    if (ppv == nullptr) {
        return E_POINTER;
    }
    *ppv = nullptr;
    auto* object = new (std::nothrow) CLocalSipProxy();
    if (object == nullptr) {
        return E_OUTOFMEMORY;
    }
    object->UseTypeLibrary(library);
    object->AddRef();  // keeps it alive through a failed construction or query
    HRESULT hr = object->CreateMessageWindow() ? S_OK : E_FAIL;
    if (SUCCEEDED(hr)) {
        hr = object->QueryInterface(riid, ppv);
    }
    object->Release();
    return hr;
}

CLocalSipProxy::~CLocalSipProxy() = default;

HRESULT CLocalSipProxy::GetRelayCounts(uint64_t* toServer, uint64_t* toClient, uint64_t* dropped) {
    if (toServer == nullptr || toClient == nullptr || dropped == nullptr) {
        return E_POINTER;
    }
    const RelayCounts counts = Counts();
    *toServer = counts.toServer;
    *toClient = counts.toClient;
    *dropped = counts.dropped;
    return S_OK;
}

HRESULT CLocalSipProxy::get_PublicContact(BSTR* pVal) {
    return portmanager::CopyBstrOut(PublicContact(), pVal);
}

HRESULT CLocalSipProxy::get_ServerEndpoint(BSTR* pVal) {
    return portmanager::CopyBstrOut(ServerEndpoint(), pVal);
}

HRESULT CLocalSipProxy::QueryInterface(REFIID riid, void** ppv) {
    if (ppv == nullptr) {
        return E_POINTER;
    }
    if (riid == IID_IUnknown || riid == IID_IDispatch || riid == IID_ILocalSipProxy) {
        *ppv = static_cast<ILocalSipProxy*>(this);
        AddRef();
        return S_OK;
    }
    if (riid == IID_ILocalSipProxyStatus) {
        *ppv = static_cast<ILocalSipProxyStatus*>(this);
        AddRef();
        return S_OK;
    }
    *ppv = nullptr;
    return E_NOINTERFACE;
}

ULONG CLocalSipProxy::AddRef() {
    return ++m_refs;
}

ULONG CLocalSipProxy::Release() {
    const ULONG left = --m_refs;
    if (left == 0) {
        m_refs = 1;  // a reference taken and dropped during the final release must not recurse
        Stop();
        DestroyMessageWindow();
        delete this;
    }
    return left;
}

HRESULT CLocalSipProxy::get_InternalAddress(BSTR* pVal) {
    NQ_TRACE_ENTERED("CLocalSipProxy::get_InternalAddress");
    return portmanager::CopyBstrOut(m_internalSocket.LocalAddressText(), pVal);
}

HRESULT CLocalSipProxy::put_InternalAddress(BSTR newVal) {
    NQ_TRACE_ENTERED("CLocalSipProxy::put_InternalAddress");
    if (newVal == nullptr) {
        return E_POINTER;
    }
    if (m_running) {
        // The sender thread receives on this socket; it may change only while stopped.
        return E_FAIL;
    }
    // Open closes the socket it held first, so a second address leaks nothing.
    m_internalSocket.Open(Utf8FromBstr(newVal), 0);
    return S_OK;
}

HRESULT CLocalSipProxy::get_SenderEndpoint(BSTR* pVal) {
    NQ_TRACE_ENTERED("CLocalSipProxy::get_SenderEndpoint");
    return portmanager::CopyBstrOut(
        m_internalSocket.LocalAddressText() + ":" + std::to_string(m_internalSocket.LocalPort()),
        pVal);
}

HRESULT CLocalSipProxy::Start(IAdvancedPortManager* pPortManager, LONG minPort, LONG maxPort,
                              VARIANT_BOOL vbRandomize) {
    NQ_TRACE_ENTERED("CLocalSipProxy::Start");
    if (pPortManager == nullptr) {
        return E_POINTER;
    }
    if (m_running) {
        return S_OK;
    }
    BStr recommended;
    HRESULT hr = pPortManager->get_RecommendedSipServer(recommended.Out());
    if (FAILED(hr)) {
        return hr;
    }
    SipProxyTexts texts = m_rewriter.Texts();
    const HostPort server = SplitHostPort(recommended.Utf8());
    texts.m_serverPort = server.port;
    const uint32_t serverNet = foundation::GetIPByName(server.host, foundation::kAddressNone);
    texts.m_serverAddress =
        serverNet == foundation::kAddressNone ? std::string() : platform::InetNtoaNet(serverNet);
    if (texts.m_serverAddress.empty()) {
        m_rewriter.SetTexts(std::move(texts));
        return E_FAIL;
    }
    ComPtr<IPortMappingProvider> provider;
    hr = ComPtr<IAdvancedPortManager>(pPortManager).As(&provider);
    if (FAILED(hr)) {
        m_rewriter.SetTexts(std::move(texts));
        return hr;
    }
    BStr privateAddress;
    LONG privatePort = 0;
    LONG publicPort = 0;
    hr = provider->GetMapping(recommended.Get(), SIP, privateAddress.Out(), &privatePort,
                              m_mappingPublicAddress.Out(), &publicPort);
    if (FAILED(hr)) {
        m_rewriter.SetTexts(std::move(texts));
        return hr;
    }
    const std::string internalAddress = m_internalSocket.LocalAddressText();
    if (!m_externalSocket.Open(internalAddress, minPort, maxPort, vbRandomize != VARIANT_FALSE)) {
        // Without it nothing could reach the server: say so instead of starting a dead relay.
        NQ_LOG("CLocalSipProxy::Start", foundation::kLogError,
               "cannot open the external socket on %s", internalAddress.c_str());
        m_rewriter.SetTexts(std::move(texts));
        return E_FAIL;
    }
    m_serverHost = platform::NetToHost32(serverNet);
    texts.m_internalAddress = internalAddress;
    texts.m_mappingPublicAddress = m_mappingPublicAddress.Utf8();
    texts.m_publicContact =
        texts.m_mappingPublicAddress + ":" + std::to_string(m_externalSocket.LocalPort());
    texts.m_internalEndpoint = m_internalSocket.LocalEndpointText();
    m_rewriter.SetTexts(std::move(texts));

    m_timerId = platform::SetTimer(Handle(), kKeepAliveTimerId, kKeepAliveTimerPeriodMs);
    if (!m_receiverThread.Start([this] { ReceiverServiceProc(); }) ||
        !m_senderThread.Start([this] { SenderServiceProc(); })) {
        NQ_LOG("CLocalSipProxy::Start", foundation::kLogError, "%s", "cannot start relay threads");
        m_running = true;
        Stop();
        return E_FAIL;
    }
    m_running = true;
    return S_OK;
}

HRESULT CLocalSipProxy::Stop() {
    NQ_TRACE_ENTERED("CLocalSipProxy::Stop");
    if (!m_running) {
        return S_OK;
    }
    platform::KillTimer(Handle(), m_timerId);
    m_timerId = 0;
    // Each thread is woken through its own stop request and joined; each sends on the other's
    // socket, so both are gone before either socket closes.
    m_senderThread.Stop();
    m_receiverThread.Stop();
    m_internalSocket.Close();
    m_externalSocket.Close();
    m_running = false;
    return S_OK;
}

platform::LRESULT CLocalSipProxy::WindowProc(platform::UINT message, platform::WPARAM,
                                             platform::LPARAM, bool& handled) {
    if (message != platform::WM_TIMER) {
        handled = false;
        return 0;
    }
    OnTimer();
    return 0;
}

void CLocalSipProxy::OnTimer() {
    NQ_TRACE_ENTERED("CLocalSipProxy::OnTimer");
    const SipProxyTexts& texts = m_rewriter.Texts();
    m_externalSocket.SendTo(m_keepAliveText, m_serverHost,
                            static_cast<uint16_t>(texts.m_serverPort));
}

RelayCounts CLocalSipProxy::Counts() const {
    return RelayCounts{m_toServer.load(), m_toClient.load(), m_dropped.load()};
}

void CLocalSipProxy::SenderServiceProc() {
    Relay(kSender, m_internalSocket, true);
}

void CLocalSipProxy::ReceiverServiceProc() {
    Relay(kReceiver, m_externalSocket, false);
}

void CLocalSipProxy::Drop(const char* name, const char* what, uint32_t fromHost,
                          uint16_t fromPort) {
    ++m_dropped;
    if (fromHost == 0 && fromPort == 0) {  // an oversized datagram's sender is not reported
        NQ_LOG(name, foundation::kLogWarn, "Dropped %s datagram", what);
        return;
    }
    NQ_LOG(name, foundation::kLogWarn, "Dropped %s datagram from %s:%d", what,
           foundation::FormatHostAddress(fromHost).c_str(), fromPort);
}

void CLocalSipProxy::Relay(const char* name, foundation::UdpSocket& from, bool fromClient) {
    NQ_TRACE_ENTERED(name);
    const SipProxyTexts& texts = m_rewriter.Texts();
    foundation::UdpSocket& to = fromClient ? m_externalSocket : m_internalSocket;
    std::string received;
    // A closed socket has nothing to relay: the thread ends and waits for its owner's Stop.
    while (from.IsValid()) {
        uint32_t fromHost = 0;
        uint16_t fromPort = 0;
        const int n = from.Receive(received, fromHost, fromPort);
        if (n == platform::kSocketError) {
            const int error = platform::LastSocketError();
            if (error == platform::kErrInterrupted) {
                break;
            }
            if (error == platform::kErrMessageSize) {
                Drop(name, "oversized", fromHost, fromPort);
            } else {
                // A port unreachable report from an earlier send, for instance: not ours to end on.
                ++m_dropped;
                NQ_LOG(name, foundation::kLogWarn, "Receive failed: %d", error);
            }
            continue;
        }
        if (n == 0) {
            Drop(name, "empty", fromHost, fromPort);
            continue;
        }
        ClientEndpoint client;
        std::string out;
        if (fromClient) {
            out = m_rewriter.RewriteFromClient(received);
        } else {
            client = m_rewriter.Client();
            out = m_rewriter.RewriteFromServer(received, client);
        }
        if (out.empty()) {
            Drop(name, "STOP", fromHost, fromPort);
            continue;
        }
        platform::OutputDebugString(std::string("********* BEGIN ") + name + "\n" + received +
                                    "\n=================" + out + "******** END " + name + "\n");
        bool sent = false;
        if (fromClient) {
            sent = to.SendTo(out, m_serverHost, static_cast<uint16_t>(texts.m_serverPort));
            if (sent) {
                ++m_toServer;
            } else {
                NQ_LOG(name, foundation::kLogError, kSendFailed, texts.m_serverAddress.c_str(),
                       texts.m_serverPort);
            }
        } else {
            // The client's address is the dotted internal address from its Via: no look-up.
            const uint32_t clientNet = platform::InetAddrNet(client.m_clientAddress);
            sent = clientNet != platform::kInaddrNone && client.m_clientPort != 0 &&
                   to.SendTo(out, platform::NetToHost32(clientNet),
                             static_cast<uint16_t>(client.m_clientPort));
            if (sent) {
                ++m_toClient;
            } else {
                NQ_LOG(name, foundation::kLogError, kSendFailed, client.m_clientAddress.c_str(),
                       client.m_clientPort);
            }
        }
        if (!sent) {
            ++m_dropped;
        }
    }
    foundation::Logger().Trace(name, "%s: 0x%x", "Exited(...", 0);
}

}  // namespace sipproxy
