// The outcome of a diagnostic run: the test recorded last and, per test type, what each test
// found. Copied by value from the run's thread to the event the client receives.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>

#include <nqportmanager/NqPortManager.h>

namespace diagnostics {

struct DiagnosticTestRecord {
    int32_t m_errorCode = PMDR_TEST_NOT_RUN;
    int32_t m_testType = PMNTT_TEST_LOCATE_INTERFACE;
    std::string m_additionalInfo;
};

struct DiagnosticResult {
    // The test recorded last.
    int32_t m_errorCode = PMDR_TEST_NOT_RUN;
    int32_t m_testType = PMNTT_TEST_LOCATE_INTERFACE;
    std::string m_additionalInfo;
    // Every test but PMNTT_TEST_ECHO starts as "not run"; that one appears once recorded.
    std::map<int32_t, DiagnosticTestRecord> m_tests;

    DiagnosticResult();
};

// Sets the last-test fields and replaces the map entry of testType.
void RecordTestResult(DiagnosticResult& result, int32_t testType, int32_t errorCode,
                      const std::string& info);

// The texts of the event; a value without a text of its own is given as its decimal number.
std::string ErrorText(int32_t errorCode);
std::string TestTypeText(int32_t testType);

// An endpoint in the records' information text: host-order address and port.
struct InfoEndpoint {
    uint32_t m_address = 0;
    uint16_t m_port = 0;
};

// "" without endpoints, "(a.b.c.d:p)" with one, "(a.b.c.d:p,e.f.g.h:q)" with two.
std::string EndpointText(std::optional<InfoEndpoint> first = std::nullopt,
                         std::optional<InfoEndpoint> second = std::nullopt);

}  // namespace diagnostics
