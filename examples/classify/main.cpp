// Classifies the path to the Internet and prints what the port manager recommends, as a SIP
// client would before it enables a calling profile: the port manager created through the
// module's class factory, an event sink connected, and this thread's message loop pumped until
// the discovery reports.
//
//   classify [STUN-SERVER[,STUN-SERVER...]]
#include <cstdio>
#include <string>

#include <nqportmanager/NqPortManager.h>

namespace {

// The client's sink; it lives on main's stack, so its count is only nominal.
class Sink final : public _IAdvancedPortManagerEvents {
  public:
    HRESULT QueryInterface(REFIID riid, void** ppv) override {
        if (ppv == nullptr) {
            return E_POINTER;
        }
        if (riid != IID_IUnknown && riid != DIID__IAdvancedPortManagerEvents) {
            *ppv = nullptr;
            return E_NOINTERFACE;
        }
        *ppv = static_cast<_IAdvancedPortManagerEvents*>(this);
        return S_OK;
    }
    ULONG AddRef() override { return 2; }
    ULONG Release() override { return 1; }
    HRESULT Event(PM_EVENT type, IDispatch*) override {
        updated = updated || type == PME_UPDATED;
        return S_OK;
    }
    bool updated = false;
};

int Updated(void* sink) {
    return static_cast<Sink*>(sink)->updated ? 1 : 0;
}

std::string Text(IAdvancedPortManager* pm, HRESULT (IAdvancedPortManager::*get)(BSTR*)) {
    BStr text;
    (pm->*get)(text.Out());
    return text.Utf8();
}

}  // namespace

int main(int argc, char** argv) {
    const char* servers = argc > 1 ? argv[1] : "stun.example.net";
    ComPtr<IClassFactory> factory;
    ComPtr<IAdvancedPortManager> pm;
    if (FAILED(DllGetClassObject(CLSID_AdvancedPortManager, IID_IClassFactory,
                                 factory.GetVoidAddressOf())) ||
        FAILED(factory->CreateInstance(nullptr, IID_IAdvancedPortManager, pm.GetVoidAddressOf()))) {
        std::fprintf(stderr, "classify: cannot create the port manager\n");
        return 1;
    }
    factory.Reset();

    Sink sink;
    DWORD cookie = 0;
    ComPtr<IConnectionPoint> point;
    const auto container = pm.As<IConnectionPointContainer>();
    if (!container ||
        FAILED(container->FindConnectionPoint(DIID__IAdvancedPortManagerEvents,
                                              point.GetAddressOf())) ||
        FAILED(point->Advise(&sink, &cookie))) {
        std::fprintf(stderr, "classify: cannot connect to the events\n");
        return 1;
    }

    // No UPnP search here: it would multicast on the local network.
    BStr stun(servers);
    BStr sip("sip.example.net");
    BStr media("media.example.net");
    if (FAILED(pm->InitializeEx(stun.Get(), 5004, 16, sip.Get(), media.Get(), VARIANT_TRUE,
                                VARIANT_FALSE)) ||
        NqRunMessageLoopUntil(Updated, &sink, 60000) == 0) {
        std::fprintf(stderr, "classify: the discovery did not report\n");
        return 1;
    }

    PM_STATE state{};
    PM_TOPOLOGY topology{};
    pm->get_State(&state);
    pm->get_Topology(&topology);
    std::printf("state %d, topology %d\n", static_cast<int>(state), static_cast<int>(topology));
    std::printf("private %s, public %s\n",
                Text(pm.Get(), &IAdvancedPortManager::get_PrivateIpAddress).c_str(),
                Text(pm.Get(), &IAdvancedPortManager::get_PublicIpAddress).c_str());
    std::printf("SIP server %s\n",
                Text(pm.Get(), &IAdvancedPortManager::get_RecommendedSipServer).c_str());

    point->Unadvise(cookie);
    pm->Shutdown();
    point.Reset();
    pm.Reset();
    return 0;
}
