// The local SIP proxy: relays SIP over UDP between the client on this machine and its SIP
// server, rewriting addresses on the way, with a keep-alive to the server every 30 s.
#pragma once

#include <atomic>
#include <cstdint>
#include <string>

#include <nqportmanager/NqPortManager.h>

#include "foundation/UdpSocket.h"
#include "platform/kernel.h"
#include "platform/message.h"
#include "platform/modulelock.h"
#include "portmanager/Dispatch.h"
#include "sipproxy/SipRewriter.h"

namespace sipproxy {

inline constexpr uintptr_t kKeepAliveTimerId = 1000;
inline constexpr uint32_t kKeepAliveTimerPeriodMs = 30000;

// Datagrams since creation, for a host's report.
struct RelayCounts {
    uint64_t toServer = 0;
    uint64_t toClient = 0;
    uint64_t dropped = 0;
};

class CLocalSipProxy final : public portmanager::TypeInfoDispatch<ILocalSipProxy>,
                             public ILocalSipProxyStatus,
                             public platform::MessageWindow {
  public:
    // Creates the object (its window included) on the calling thread, which must pump messages
    // for the keep-alive. E_FAIL when the window cannot be created.
    // Its IDispatch is served from library (none: no members).
    static HRESULT CreateInstance(REFIID riid, void** ppv, ITypeLib* library = nullptr);

    // IUnknown
    HRESULT QueryInterface(REFIID riid, void** ppv) override;
    ULONG AddRef() override;
    ULONG Release() override;

    // ILocalSipProxy
    HRESULT get_InternalAddress(BSTR* pVal) override;
    HRESULT put_InternalAddress(BSTR newVal) override;
    HRESULT get_SenderEndpoint(BSTR* pVal) override;
    HRESULT Start(IAdvancedPortManager* pPortManager, LONG minPort, LONG maxPort,
                  VARIANT_BOOL vbRandomize) override;
    HRESULT Stop() override;

    // ILocalSipProxyStatus
    HRESULT GetRelayCounts(uint64_t* toServer, uint64_t* toClient, uint64_t* dropped) override;
    HRESULT get_PublicContact(BSTR* pVal) override;
    HRESULT get_ServerEndpoint(BSTR* pVal) override;

    platform::LRESULT WindowProc(platform::UINT message, platform::WPARAM wParam,
                                 platform::LPARAM lParam, bool& handled) override;

    RelayCounts Counts() const;
    // After a successful Start: what the server is to use for the client, and the server.
    std::string PublicContact() const { return m_rewriter.Texts().m_publicContact; }
    std::string ServerEndpoint() const {
        return m_rewriter.Texts().m_serverAddress + ":" +
               std::to_string(m_rewriter.Texts().m_serverPort);
    }

  private:
    CLocalSipProxy() = default;
    ~CLocalSipProxy() override;

    void OnTimer();
    void SenderServiceProc();
    void ReceiverServiceProc();
    // One relay loop: receives on `from` until the owner's stop, forwards on `to`.
    void Relay(const char* name, foundation::UdpSocket& from, bool fromClient);
    void Drop(const char* name, const char* what, uint32_t fromHost, uint16_t fromPort);

    std::atomic<ULONG> m_refs{0};
    foundation::UdpSocket m_internalSocket;
    foundation::UdpSocket m_externalSocket;
    SipRewriter m_rewriter;     // the texts and the learned client
    uint32_t m_serverHost = 0;  // m_serverAddress resolved, host order
    BStr m_mappingPublicAddress;
    uintptr_t m_timerId = 0;
    std::string m_keepAliveText = "CONT";
    bool m_running = false;
    platform::Thread m_senderThread;
    platform::Thread m_receiverThread;
    std::atomic<uint64_t> m_toServer{0};
    std::atomic<uint64_t> m_toClient{0};
    std::atomic<uint64_t> m_dropped{0};
    platform::ModuleReference m_moduleLock;
};

}  // namespace sipproxy
