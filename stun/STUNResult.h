// The background service that classifies every usable local IPv4 address with the classic STUN
// procedure whenever it is asked to refresh, keeps the last complete list and tells its owner's
// window when a pass has ended.
#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <string>

#include "foundation/NetworkChangeMonitor.h"
#include "nqportmanager/com.h"
#include "platform/kernel.h"
#include "platform/message.h"
#include "platform/netinfo.h"
#include "stun/STUNResults.h"

namespace stun {

// The service as its owner drives it (a double can stand in for it).
class ISTUNResult {
  public:
    // Starts the service if needed and asks for a classification pass; clears the ready flag.
    virtual HRESULT Refresh() = 0;
    // Ends the service thread, also in the middle of a pass (which then stores nothing). The
    // ready flag and the last results stay.
    virtual void Stop() = 0;
    virtual bool IsRunning() = 0;
    virtual bool IsSTUNResultReady() = 0;
    // Waits (polling every second) until a pass has stored results, then copies them. True with
    // the copy. False, copying nothing, when result is null or no pass that would end the wait
    // is asked for (none was, or Stop cancelled it), or the service's or the calling thread
    // ended.
    virtual bool GetSTUNResult(STUNResultList* result) = 0;
    virtual ~ISTUNResult() = default;
    // Creates the refresh event and the service thread and starts the monitor; S_OK when
    // already running. Classifies nothing by itself.
    virtual HRESULT Start() = 0;
};

class CSTUNResult : public ISTUNResult, public foundation::INetworkChangeSink {
  public:
    static constexpr size_t kMaxServerListLength = 1023;
    static constexpr int kPollMs = 1000;

    // servers: comma-separated names or dotted quads (null is logged and taken as empty). After
    // every pass, message is posted to window with wParam and lParam 0. The local addresses
    // come from networkInfo, which outlives the service.
    CSTUNResult(const char* servers, platform::WindowHandle window, platform::UINT message,
                platform::WPARAM wParam,
                platform::NetworkInfo& networkInfo = platform::SystemNetworkInfo());
    ~CSTUNResult() override;
    CSTUNResult(const CSTUNResult&) = delete;
    CSTUNResult& operator=(const CSTUNResult&) = delete;

    HRESULT Refresh() override;
    void Stop() override;
    bool IsRunning() override;
    bool IsSTUNResultReady() override;
    bool GetSTUNResult(STUNResultList* result) override;
    HRESULT Start() override;

    // Only logged: a network change reaches the service through its owner calling Refresh.
    void OnLocalIPsChanged() override;
    void OnRouteChanged() override;

  private:
    static void STUNResultThread(CSTUNResult* self);
    void ProcessSTUNResultThread();
    // One entry per local address (at most kMaxSTUNResults); false when stopped midway.
    bool ClassifyLocalAddresses(STUNResultList& list);
    void RefreshResults();
    bool IsRunningLocked() const;

    platform::CriticalSection m_lock;  // the three fields below; never held during traffic
    bool m_ready = false;
    uint64_t m_refreshCount = 0;  // Refresh calls so far: a pass is current only if none came
    bool m_passAwaited = false;   // a Refresh is not yet answered by a current pass
    STUNResultList m_results;

    std::string m_servers;
    foundation::CNetworkChangeMonitor m_monitor;
    const platform::WindowHandle m_window;
    const platform::UINT m_message;
    const platform::WPARAM m_wParam;

    std::mutex m_lifecycle;  // the event and the thread, so Stop may come from any thread
    std::unique_ptr<platform::Event> m_refreshEvent;
    platform::Thread m_thread;
};

}  // namespace stun
