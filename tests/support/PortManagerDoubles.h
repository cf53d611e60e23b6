// Doubles around the port manager: a client's event sink, and a STUN result service whose
// passes complete at once with a list the test sets.
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <vector>

#include <nqportmanager/NqPortManager.h>

#include "portmanager/AdvancedPortManager.h"
#include "stun/STUNResult.h"

namespace testsupport {

// A client's sink. Counts its references so a test can see that nothing leaks.
class RecordingSink final : public _IAdvancedPortManagerEvents {
  public:
    struct Received {
        PM_EVENT type;
        IAdvancedPortManager* portManager;  // from the event object (not held)
        PM_STATE state;
    };

    RecordingSink() = default;

    HRESULT QueryInterface(REFIID riid, void** ppv) override;
    ULONG AddRef() override { return ++refs; }
    ULONG Release() override { return --refs; }  // lives on the test's stack
    HRESULT Event(PM_EVENT type, IDispatch* event) override;

    std::vector<Received> received;
    // How many further queries for the event interface succeed (-1: all).
    int answerEventQueries = -1;
    std::function<void(PM_EVENT)> onEvent;
    std::vector<RecordingSink*>* order = nullptr;  // shared log of which sink ran when
    std::atomic<ULONG> refs{0};
};

// Stands in for the STUN result service: each Refresh ends a pass at once by posting the
// completion message with the list the test set.
class FakeStunService final : public stun::ISTUNResult {
  public:
    FakeStunService(platform::WindowHandle window, platform::UINT message, platform::WPARAM wParam)
        : m_window(window), m_message(message), m_wParam(wParam) {}

    HRESULT Refresh() override;
    void Stop() override { running = false; }
    bool IsRunning() override { return running; }
    bool IsSTUNResultReady() override { return ready; }
    bool GetSTUNResult(stun::STUNResultList* result) override;
    HRESULT Start() override {
        running = true;
        return S_OK;
    }

    stun::STUNResultList list;
    bool ready = false;
    bool running = false;
    bool postOnRefresh = true;
    int refreshes = 0;

  private:
    platform::WindowHandle m_window;
    platform::UINT m_message;
    platform::WPARAM m_wParam;
};

// A port manager whose STUN service is a FakeStunService (null until InitializeEx2); its other
// services are those given.
struct PortManagerWithFakeStun {
    explicit PortManagerWithFakeStun(portmanager::PortManagerServices services = {});
    PortManagerWithFakeStun(const PortManagerWithFakeStun&) = delete;
    PortManagerWithFakeStun& operator=(const PortManagerWithFakeStun&) = delete;

    // Connects the sink; returns its cookie.
    DWORD Connect(RecordingSink& sink);
    HRESULT Initialize(bool upnp, bool stun, const char* sipProxy = "sip.example.net",
                       const char* mediaProxy = "media.example.net");

    ComPtr<IAdvancedPortManager> pm;
    FakeStunService* stun = nullptr;  // owned by the port manager
    stun::STUNResultList nextList;    // handed to the service when it is created
    bool nextReady = true;
};

// The system's services but for the network information (and the UPnP probe, unless null).
portmanager::PortManagerServices ServicesWith(platform::NetworkInfo& net,
                                              platform::UpnpGatewayProbe* upnp = nullptr);

std::string ToUtf8(BSTR text);  // frees text

}  // namespace testsupport
