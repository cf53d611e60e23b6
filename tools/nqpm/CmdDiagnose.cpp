// nqpm diagnose: one diagnostic run through the port manager, as a softphone would ask for it.
#include <cstdio>

#include "tools/nqpm/Cli.h"
#include "tools/nqpm/Commands.h"
#include "tools/nqpm/ModuleClient.h"

namespace nqpm {

namespace {

const char* const kUsage =
    "usage: nqpm diagnose --well-known A.B.C.D --stun NAME --echo HOST[:PORT] [--timeout MS]\n"
    "                     [--module PATH] [--json]\n"
    "Runs the network diagnostics: the interface and gateway toward the well-known address, the\n"
    "STUN server's name and an answer on UDP port 3478, then a login to the echo server (port\n"
    "default 7) with SIP and media echoes, every wait at most the time-out (default 5000 ms).\n"
    "Prints the outcome and every test; exit 0 when all passed, 1 otherwise.\n";

constexpr uint16_t kDefaultEchoPort = 7;
constexpr LONG kCookie = 1;

struct Outcome {
    PM_DIAGNOSTIC_RESULT code = PMDR_TEST_NOT_RUN;
    std::string errorText;
    PM_DIAGNOSTIC_TEST_TYPE type = PMNTT_TEST_LOCATE_INTERFACE;
    std::string typeText;
    std::string info;
    LONG cookie = 0;
    struct Test {
        PM_DIAGNOSTIC_TEST_TYPE type;
        std::string typeText;
        PM_DIAGNOSTIC_RESULT code;
        std::string errorText;
        std::string info;
    };
    std::vector<Test> tests;
};

std::string Text(INetworkDiagnosticEvent* e, HRESULT (INetworkDiagnosticEvent::*getter)(BSTR*)) {
    BStr value;
    (e->*getter)(value.Out());
    return value.Utf8();
}

// The client's sink: keeps what the first diagnostic event says.
class DiagnosticClient final : public _IAdvancedPortManagerEvents {
  public:
    HRESULT QueryInterface(REFIID riid, void** ppv) override {
        if (ppv == nullptr) {
            return E_POINTER;
        }
        if (riid == IID_IUnknown || riid == DIID__IAdvancedPortManagerEvents) {
            *ppv = static_cast<_IAdvancedPortManagerEvents*>(this);
            return S_OK;
        }
        *ppv = nullptr;
        return E_NOINTERFACE;
    }
    ULONG AddRef() override { return 2; }  // lives on the stack of its command
    ULONG Release() override { return 1; }
    HRESULT Event(PM_EVENT type, IDispatch* event) override {
        ComPtr<INetworkDiagnosticEvent> e;
        if (type != PME_DIAGNOSTIC_COMPLETED || done || event == nullptr ||
            FAILED(event->QueryInterface(IID_INetworkDiagnosticEvent, e.GetVoidAddressOf()))) {
            return S_OK;
        }
        e->get_errorCode(&outcome.code);
        e->get_TestType(&outcome.type);
        e->get_cookie(&outcome.cookie);
        outcome.errorText = Text(e.Get(), &INetworkDiagnosticEvent::get_ErrorText);
        outcome.typeText = Text(e.Get(), &INetworkDiagnosticEvent::get_TestTypeText);
        outcome.info = Text(e.Get(), &INetworkDiagnosticEvent::get_AdditionalInfo);
        if (const auto tests = e.As<INetworkDiagnosticTests>()) {
            LONG count = 0;
            tests->get_TestCount(&count);
            for (LONG i = 0; i < count; ++i) {
                Outcome::Test t{};
                BStr typeText, errorText, info;
                if (SUCCEEDED(tests->GetTest(i, &t.type, typeText.Out(), &t.code, errorText.Out(),
                                             info.Out()))) {
                    t.typeText = typeText.Utf8();
                    t.errorText = errorText.Utf8();
                    t.info = info.Utf8();
                    outcome.tests.push_back(std::move(t));
                }
            }
        }
        done = true;
        return S_OK;
    }

    Outcome outcome;
    bool done = false;
};

Json OutcomeJson(const Outcome& o) {
    Json tests = Json::array();
    for (const Outcome::Test& t : o.tests) {
        tests.push_back(Json{{"type", static_cast<int64_t>(t.type)},
                             {"text", t.typeText},
                             {"error_code", static_cast<int64_t>(t.code)},
                             {"error_text", t.errorText},
                             {"info", t.info}});
    }
    return Json{{"error_code", static_cast<int64_t>(o.code)},
                {"error_text", o.errorText},
                {"test_type", static_cast<int64_t>(o.type)},
                {"test_type_text", o.typeText},
                {"additional_info", o.info},
                {"cookie", static_cast<int64_t>(o.cookie)},
                {"tests", tests}};
}

}  // namespace

int RunDiagnose(int argc, char** argv) {
    Options options(
        "diagnose",
        {{"well-known", true}, {"stun", true}, {"echo", true}, {"timeout", true}, {"module", true}},
        kUsage);
    options.Parse(argc, argv);
    if (options.WantsHelp()) {
        std::fputs(kUsage, stdout);
        return kExitOk;
    }
    const std::string wellKnown = options.Required("well-known");
    ParseDottedQuad("well-known", wellKnown);
    const std::string stun = options.Required("stun");
    const HostPort echo = ParseHostPort("echo", options.Required("echo"), kDefaultEchoPort);
    const int64_t timeout = options.Has("timeout") ? options.Integer("timeout", 0, 600000) : 5000;
    RouteInterrupts();
    const ModuleClient module(options.Value("module"));
    ComPtr<IAdvancedPortManager> pm;
    HRESULT hr =
        module.Create(CLSID_AdvancedPortManager, IID_IAdvancedPortManager, pm.GetVoidAddressOf());
    if (FAILED(hr)) {
        std::fprintf(stderr, "nqpm: cannot create the port manager (0x%08X)\n",
                     static_cast<unsigned>(hr));
        return kExitFailed;
    }
    module.ConfigureLogging(LogSettingsOf(options), pm.Get());
    DiagnosticClient client;
    ComPtr<IConnectionPoint> point;
    DWORD cookie = 0;
    if (const auto container = pm.As<IConnectionPointContainer>()) {
        container->FindConnectionPoint(DIID__IAdvancedPortManagerEvents, point.GetAddressOf());
    }
    if (!point || FAILED(point->Advise(&client, &cookie))) {
        std::fprintf(stderr, "nqpm: cannot connect to the port manager's events\n");
        return kExitFailed;
    }
    BStr a(wellKnown), s(stun), e(echo.host);
    hr = pm->DiagnoseNetwork(a.Get(), s.Get(), e.Get(), echo.port, static_cast<LONG>(timeout),
                             kCookie);
    if (FAILED(hr)) {
        std::fprintf(stderr, "nqpm: DiagnoseNetwork failed (0x%08X)\n", static_cast<unsigned>(hr));
        point->Unadvise(cookie);
        return kExitFailed;
    }
    Progress("diagnosing the network (interface, DNS, STUN, echo server)");
    module.RunUntil([&] { return client.done; }, -1);
    point->Unadvise(cookie);
    pm->Shutdown();
    if (!client.done) {
        std::fprintf(stderr, "nqpm: interrupted before the diagnostics reported\n");
        return kExitFailed;
    }
    const Outcome& o = client.outcome;
    if (options.Json()) {
        PrintJson(OutcomeJson(o));
    } else {
        std::printf("error code:      %d (%s)\n", static_cast<int>(o.code), o.errorText.c_str());
        std::printf("test type:       %d (%s)\n", static_cast<int>(o.type), o.typeText.c_str());
        std::printf("additional info: %s\n", o.info.c_str());
        std::printf("cookie:          %ld\n", static_cast<long>(o.cookie));
        std::printf("tests:\n");
        for (const Outcome::Test& t : o.tests) {
            std::printf("  %2d %-32s %2d %s%s%s\n", static_cast<int>(t.type), t.typeText.c_str(),
                        static_cast<int>(t.code), t.errorText.c_str(), t.info.empty() ? "" : " ",
                        t.info.c_str());
        }
    }
    std::fflush(stdout);
    return o.code == PMDR_NO_ERROR ? kExitOk : kExitFailed;
}

}  // namespace nqpm
