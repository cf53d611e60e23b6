// Thousands of cycles of what a softphone does over a long day, with real peers on loopback:
// afterwards the process holds the descriptors and threads it started with, and its resident
// memory has not grown past a small bound.
#include <dlfcn.h>
#include <gtest/gtest.h>

#include <chrono>
#include <fstream>
#include <iostream>
#include <optional>
#include <string>
#include <thread>

#include <nqportmanager/NqPortManager.h>

#include "foundation/NetUtils.h"
#include "tests/sipproxy/proxy_test_support.h"
#include "tests/support/EchoServer.h"
#include "tests/support/LeakCheck.h"
#include "tests/support/Stund.h"

namespace {

using sipproxy::testing::LoopbackSocket;

const std::string kModule = std::string(NQPM_BINARY_DIR) + "/lib/libNqPortManager.so";

long ResidentKiB() {
    std::ifstream statm("/proc/self/statm");
    long size = 0;
    long resident = 0;
    statm >> size >> resident;
    return resident * 4;
}

// The port manager and proxy of the proxy tests (profile enabled, SIP server on loopback), and
// for the diagnostic runs stund and the echo server.
class Soak : public sipproxy::testing::ProxyFixture {
  public:
    void SetUp() override {
        ProxyFixture::SetUp();
        ASSERT_EQ(h.pm->QueryInterface(IID_IPortMappingProvider, provider.GetVoidAddressOf()),
                  S_OK);
    }

    void ProfileCycle() {
        ASSERT_EQ(h.pm->OnBeforeDisableProfile(), S_OK);
        VARIANT v;
        VariantInit(&v);
        v.vt = VT_ARRAY | VT_BSTR;
        v.parray = MakeBstrArray({"127.0.0.1:" + std::to_string(sipMappingPort)});
        const HRESULT hr = h.pm->OnBeforeEnableProfileEx(v, sipMappingPort - 22, sipMappingPort - 2,
                                                         2, VARIANT_TRUE);
        VariantClear(&v);
        ASSERT_EQ(hr, S_OK);
        for (LONG type : {SIP, AudioRTP, AudioRTCP, VideoRTP, VideoRTCP}) {
            BStr none("");
            BStr priv;
            BStr pub;
            LONG privatePort = 0;
            LONG publicPort = 0;
            ASSERT_EQ(provider->GetMapping(none.Get(), type, priv.Out(), &privatePort, pub.Out(),
                                           &publicPort),
                      S_OK)
                << type;
            if (type != SIP) {  // taken for a call's media: kept alive, then released
                BStr remote("127.0.0.1");
                ASSERT_EQ(provider->UpdateRemoteAddressEx(remote.Get(), server.Port(), priv.Get(),
                                                          privatePort, pub.Get(), publicPort),
                          S_OK);
                ASSERT_EQ(provider->ReleaseMapping(priv.Get(), privatePort, pub.Get(), publicPort),
                          S_OK);
            }
        }
    }

    void ProxyCycle() {
        ASSERT_EQ(StartProxy(), S_OK);
        LoopbackSocket client;
        ExpectRegisterRelayed(client, "z9hG4bKsoak");
        ASSERT_EQ(proxy->Stop(), S_OK);
    }

    void ModuleCycle() {
        if (module == nullptr) {
            module = dlopen(kModule.c_str(), RTLD_NOW | RTLD_LOCAL);
            ASSERT_NE(module, nullptr) << dlerror();
            getClassObject =
                reinterpret_cast<decltype(getClassObject)>(dlsym(module, "DllGetClassObject"));
            ASSERT_NE(getClassObject, nullptr);
        }
        for (const CLSID& clsid : {CLSID_AdvancedPortManager, CLSID_LocalSipProxy}) {
            ComPtr<IClassFactory> factory;
            ASSERT_EQ(getClassObject(clsid, IID_IClassFactory, factory.GetVoidAddressOf()), S_OK);
            ComPtr<IUnknown> object;
            ASSERT_EQ(factory->CreateInstance(nullptr, IID_IUnknown, object.GetVoidAddressOf()),
                      S_OK);
        }
    }
    void EndModule() {
        ASSERT_NE(module, nullptr);
        auto canUnloadNow = reinterpret_cast<HRESULT (*)()>(dlsym(module, "DllCanUnloadNow"));
        ASSERT_NE(canUnloadNow, nullptr);
        EXPECT_EQ(canUnloadNow(), S_OK);
        EXPECT_EQ(dlclose(module), 0);
        module = nullptr;
        EXPECT_EQ(dlopen(kModule.c_str(), RTLD_NOW | RTLD_NOLOAD), nullptr)
            << "libNqPortManager.so is still loaded after dlclose";
    }

    // A network whose well-known address has a route and a gateway, so that every run goes
    // through STUN and the echo tests to the end.
    struct AnyRoute : platform::RouteLookup {
        int BestInterface(uint32_t, uint32_t* index) override {
            *index = 1;
            return 0;
        }
    };
    void DiagnosticCycle() {
        if (!diagnosing) {
            if (!testsupport::Stund::IsInstalled()) {
                GTEST_SKIP() << "stund is not installed";
            }
            std::string why;
            ASSERT_TRUE(stund.Start(&why)) << why;
            ASSERT_TRUE(echo.Start());
            diagNet.AddInterface("127.0.0.1", "127.0.0.254");
            portmanager::PortManagerServices services = testsupport::ServicesWith(diagNet);
            services.routeLookup = &routes;
            diagnosing.emplace(services);
            diagnosing->Connect(diagSink);
        }
        const size_t before = diagSink.received.size();
        BStr wellKnown("192.0.2.1");
        BStr stun(foundation::FormatHostAddress(stund.PrimaryAddress()));
        BStr echoHost("127.0.0.1");
        ASSERT_EQ(diagnosing->pm->DiagnoseNetwork(wellKnown.Get(), stun.Get(), echoHost.Get(),
                                                  echo.Port(), 2000, 1),
                  S_OK);
        ASSERT_TRUE(platform::RunMessageLoopUntil([&] { return diagSink.received.size() > before; },
                                                  20000));
        EXPECT_EQ(diagSink.received.back().type, PME_DIAGNOSTIC_COMPLETED);
        // A clean run sends four SIP and four media samples to the echo server, and closes its
        // control connection.
        EXPECT_EQ(echo.Datagrams().size(), 8 * diagSink.received.size());
        ASSERT_TRUE(echo.WaitIdle(2000));
    }

    ComPtr<IPortMappingProvider> provider;
    void* module = nullptr;
    HRESULT (*getClassObject)(REFCLSID, REFIID, void**) = nullptr;
    testsupport::Stund stund;
    testsupport::EchoServer echo;
    testsupport::FakeNetworkInfo diagNet;
    AnyRoute routes;
    testsupport::RecordingSink diagSink;  // outlives the port manager below
    std::optional<testsupport::PortManagerWithFakeStun> diagnosing;
};

struct Cycles {
    const char* name;
    int count;
    void (Soak::*cycle)();
    void (Soak::*end)();
};

void PrintTo(const Cycles& c, std::ostream* os) {
    *os << c.name;
}

class SoakCycles : public Soak, public ::testing::WithParamInterface<Cycles> {};

TEST_P(SoakCycles, LeaveDescriptorsThreadsAndMemoryFlat) {
    const Cycles& c = GetParam();
    // The first tenth settles what is made once (pools, caches, the peers); a cycle with an end
    // step (the module's dlclose) must give back even that.
    const testsupport::ProcessResources before = testsupport::ProcessResources::Now();
    const int warmUp = c.count / 10;
    for (int i = 0; i < warmUp && !HasFatalFailure() && !IsSkipped(); ++i) {
        (this->*c.cycle)();
    }
    const testsupport::ProcessResources start =
        c.end != nullptr ? before : testsupport::ProcessResources::Now();
    const long startKiB = ResidentKiB();
    for (int i = warmUp; i < c.count && !HasFatalFailure(); ++i) {
        ASSERT_NO_FATAL_FAILURE((this->*c.cycle)()) << "cycle " << i;
    }
    if (c.end != nullptr) {
        (this->*c.end)();
    }
    // The last run's or relay's thread may still be on its way out, with its sockets.
    testsupport::ProcessResources end = testsupport::ProcessResources::Now();
    for (int i = 0; i < 150 && end.threads.size() > start.threads.size(); ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
        end = testsupport::ProcessResources::Now();
    }
    // The same numbers; a re-made pool's sockets are new ones under them.
    const auto numbers = [](const testsupport::ProcessResources& r) {
        std::string text;
        for (const auto& [number, target] : r.descriptors) {
            text += number + " ";
        }
        return text;
    };
    EXPECT_EQ(numbers(end), numbers(start));
    EXPECT_EQ(end.threads.size(), start.threads.size());
    const long grownKiB = ResidentKiB() - startKiB;
#if !defined(__SANITIZE_ADDRESS__) && !defined(__SANITIZE_THREAD__)
    // The sanitizers keep freed memory in quarantine; their own leak check covers those builds.
    EXPECT_LT(grownKiB, 2048) << "resident memory grew by " << grownKiB << " KiB";
#endif
    std::cout << c.name << ": " << c.count << " cycles, resident memory " << grownKiB
              << " KiB more than after the first " << warmUp << "\n";
}

INSTANTIATE_TEST_SUITE_P(
    Table, SoakCycles,
    ::testing::Values(
        Cycles{"ProfileEnableAndDisableWithMappings", 1000, &Soak::ProfileCycle, nullptr},
        Cycles{"ProxyStartAndStopWithTraffic", 1000, &Soak::ProxyCycle, nullptr},
        Cycles{"ModuleClassesThenDlclose", 1000, &Soak::ModuleCycle, &Soak::EndModule},
        Cycles{"DiagnosticRuns", 100, &Soak::DiagnosticCycle, nullptr}),
    [](const ::testing::TestParamInfo<Cycles>& info) { return std::string(info.param.name); });

}  // namespace
