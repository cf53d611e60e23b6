#include "platform/upnp.h"

#include <windows.h>

// The ids of natupnp.h defined here, in this file only.
#include <initguid.h>

#include <natupnp.h>

#include "platform/kernel.h"

namespace platform {

namespace {

// COM on the calling thread for one question, as the UPnP thread asks it.
class ComApartment {
  public:
    ComApartment() : hr_(CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED)) {}
    ~ComApartment() {
        if (SUCCEEDED(hr_)) {
            CoUninitialize();
        }
    }
    ComApartment(const ComApartment&) = delete;
    ComApartment& operator=(const ComApartment&) = delete;

  private:
    HRESULT hr_;
};

template <typename T>
void ReleaseIf(T* p) {
    if (p != nullptr) {
        p->Release();
    }
}

class UpnpNatGatewayProbe final : public UpnpGatewayProbe {
  public:
    bool GatewayPresent() override {
        if (CurrentThreadStopRequested()) {
            return false;
        }
        ComApartment apartment;
        IUPnPNAT* nat = nullptr;
        if (FAILED(CoCreateInstance(CLSID_UPnPNAT, nullptr, CLSCTX_ALL, IID_IUPnPNAT,
                                    reinterpret_cast<void**>(&nat))) ||
            nat == nullptr) {
            return false;
        }
        // The system searches the network here; the collection is null when no gateway that
        // can map ports answered.
        IStaticPortMappingCollection* mappings = nullptr;
        const HRESULT hr = nat->get_StaticPortMappingCollection(&mappings);
        const bool present = SUCCEEDED(hr) && mappings != nullptr;
        ReleaseIf(mappings);
        nat->Release();
        return present && !CurrentThreadStopRequested();
    }
};

}  // namespace

UpnpGatewayProbe& SystemUpnpGatewayProbe() {
    static UpnpNatGatewayProbe probe;
    return probe;
}

}  // namespace platform
