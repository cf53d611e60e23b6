#include "stun/STUNResult.h"

#include <vector>

#include "foundation/Logger.h"
#include "stun/STUNClassify.h"

namespace stun {

namespace {
constexpr const char* kEntered = "Entered...";
constexpr const char* kConstructor = "CSTUNResult::CSTUNResult";
constexpr const char* kThread = "CSTUNResult::STUNResultThread";
constexpr const char* kProcess = "CSTUNResult::ProcessSTUNResultThread";
constexpr const char* kGetResult = "CSTUNResult::GetSTUNResult";
constexpr uint32_t kWaitFailed = 0xFFFFFFFFu;  // WAIT_FAILED
}  // namespace

CSTUNResult::CSTUNResult(const char* servers, platform::WindowHandle window, platform::UINT message,
                         platform::WPARAM wParam, platform::NetworkInfo& networkInfo)
    : m_monitor(networkInfo), m_window(window), m_message(message), m_wParam(wParam) {
    NQ_TRACE_ENTERED(kConstructor);
    if (servers == nullptr) {
        NQ_LOG(kConstructor, foundation::kLogError,
               "Failed Assertion (line %d) - szSTUNServer != NULL", 19);
    } else {
        m_servers.assign(servers);
        if (m_servers.size() > kMaxServerListLength) {
            m_servers.resize(kMaxServerListLength);
        }
    }
}

CSTUNResult::~CSTUNResult() {
    NQ_TRACE_ENTERED("CSTUNResult::~CSTUNResult");
    Stop();
}

HRESULT CSTUNResult::Start() {
    NQ_TRACE_ENTERED("CSTUNResult::Start");
    std::lock_guard<std::mutex> lifecycle(m_lifecycle);
    if (IsRunningLocked()) {
        return S_OK;
    }
    auto event = std::make_unique<platform::Event>();
    if (!event->IsValid()) {
        // A bare positive code would pass every SUCCEEDED check up to the port manager.
        return event->Error() > 0 ? HRESULT_FROM_WIN32(static_cast<uint32_t>(event->Error()))
                                  : E_FAIL;
    }
    m_refreshEvent = std::move(event);
    m_monitor.Subscribe(this);
    if (!m_monitor.Start()) {
        return E_FAIL;
    }
    if (!m_thread.Start([this] { STUNResultThread(this); })) {
        return E_FAIL;
    }
    return S_OK;
}

HRESULT CSTUNResult::Refresh() {
    NQ_LOG("CSTUNResult::Refresh", foundation::kLogInfo, "%s", kEntered);
    const HRESULT hr = Start();
    if (FAILED(hr)) {
        return hr;
    }
    RefreshResults();
    return hr;
}

void CSTUNResult::RefreshResults() {
    NQ_TRACE_ENTERED("CSTUNResult::RefreshResults");
    std::lock_guard<std::mutex> lifecycle(m_lifecycle);
    {
        platform::CriticalSectionLock lock(m_lock);
        m_ready = false;
        ++m_refreshCount;
        m_passAwaited = m_refreshEvent != nullptr;
    }
    if (m_refreshEvent) {
        m_refreshEvent->Set();
    }
}

void CSTUNResult::Stop() {
    NQ_TRACE_ENTERED("CSTUNResult::Stop");
    std::lock_guard<std::mutex> lifecycle(m_lifecycle);
    m_monitor.Stop();
    m_monitor.Unsubscribe(this);
    // The thread's waits and transactions end on the stop request; neither lock is held here.
    m_thread.Stop();
    m_refreshEvent.reset();
    // A pass that was asked for is cancelled: nobody may wait for it any more.
    platform::CriticalSectionLock lock(m_lock);
    m_passAwaited = false;
}

bool CSTUNResult::IsRunning() {
    NQ_TRACE_ENTERED("CSTUNResult::IsRunning");
    std::lock_guard<std::mutex> lifecycle(m_lifecycle);
    return IsRunningLocked();
}

bool CSTUNResult::IsRunningLocked() const {
    return m_thread.IsStarted();
}

bool CSTUNResult::IsSTUNResultReady() {
    NQ_TRACE_ENTERED("CSTUNResult::IsSTUNResultReady");
    platform::CriticalSectionLock lock(m_lock);
    return m_ready;
}

bool CSTUNResult::GetSTUNResult(STUNResultList* result) {
    if (result == nullptr) {
        NQ_LOG(kGetResult, foundation::kLogError,
               "Failed Assertion (line %d) - pSTUNResult != NULL", 115);
        return false;
    }
    Start();
    for (;;) {
        // Waiting only makes sense while a pass that will set the flag is queued or running.
        {
            platform::CriticalSectionLock lock(m_lock);
            if (m_ready) {
                break;
            }
            if (!m_passAwaited) {
                return false;
            }
        }
        {
            std::lock_guard<std::mutex> lifecycle(m_lifecycle);
            if (!m_thread.IsStarted() || m_thread.HasFinished()) {
                return false;
            }
        }
        NQ_LOG(kGetResult, foundation::kLogInfo, "%s", "Waiting for STUN result...");
        if (platform::Sleep(kPollMs) == platform::WaitResult::Stopped) {
            return false;
        }
    }
    std::string text;
    {
        platform::CriticalSectionLock lock(m_lock);
        *result = m_results;
        text = FormatSTUNResults(m_results);
    }
    NQ_LOG(kGetResult, foundation::kLogInfo, "%s", text.c_str());
    return true;
}

void CSTUNResult::OnLocalIPsChanged() {
    NQ_LOG("CSTUNResult::OnLocalIPsChanged", foundation::kLogInfo, "%s", kEntered);
}

void CSTUNResult::OnRouteChanged() {
    NQ_LOG("CSTUNResult::OnRouteChanged", foundation::kLogInfo, "%s", kEntered);
}

void CSTUNResult::STUNResultThread(CSTUNResult* self) {
    NQ_TRACE_ENTERED(kThread);
    if (self == nullptr) {
        NQ_LOG(kThread, foundation::kLogError, "%s", "Failed Assertion - NULL != pSTUNResult");
        return;
    }
    self->ProcessSTUNResultThread();
}

void CSTUNResult::ProcessSTUNResultThread() {
    // Set before the thread starts and reset only after it was joined.
    platform::Event& refresh = *m_refreshEvent;
    for (;;) {
        switch (refresh.Wait(-1)) {
            case platform::WaitResult::Signaled:
                NQ_LOG(kProcess, foundation::kLogInfo, "%s", "dwWaitRet == WAIT_OBJECT_0");
                break;
            case platform::WaitResult::Timeout:
                NQ_LOG(kProcess, foundation::kLogInfo, "%s", "dwWaitRet == WAIT_TIMEOUT");
                break;
            case platform::WaitResult::Stopped:
                return;
            case platform::WaitResult::Failed:
                NQ_LOG(kProcess, foundation::kLogInfo, "dwWaitRet == 0x%x, dwErro = 0x%x",
                       kWaitFailed, 0u);
                return;
        }
        uint64_t refreshCount = 0;
        {
            platform::CriticalSectionLock lock(m_lock);
            refreshCount = m_refreshCount;
        }
        STUNResultList list;
        if (!ClassifyLocalAddresses(list)) {
            return;  // stopped midway: a partial list is no result
        }
        std::string text;
        {
            platform::CriticalSectionLock lock(m_lock);
            m_results = list;
            // A Refresh during the pass wants the pass after it.
            m_ready = refreshCount == m_refreshCount;
            m_passAwaited = m_passAwaited && !m_ready;
            text = FormatSTUNResults(m_results);
        }
        platform::PostMessage(m_window, m_message, m_wParam, 0);
        NQ_LOG(kProcess, foundation::kLogInfo, "STUN Result; %s", text.c_str());
    }
}

bool CSTUNResult::ClassifyLocalAddresses(STUNResultList& list) {
    const std::vector<uint32_t> addresses = m_monitor.GetLocalIPs();
    size_t count = addresses.size();
    if (count > kMaxSTUNResults) {
        NQ_LOG("CSTUNResult::ClassifyLocalAddresses", foundation::kLogWarn,
               "%zu local addresses; classifying the first %zu and skipping %zu", count,
               kMaxSTUNResults, count - kMaxSTUNResults);
        count = kMaxSTUNResults;
    }
    list = STUNResultList{};
    list.count = static_cast<int32_t>(count);
    for (size_t i = 0; i < count; ++i) {
        // An entry whose server does not resolve keeps STUN_RESULT_UNKNOWN and no public address.
        STUNResultEntry entry;
        entry.localAddress = addresses[i];
        int32_t index = STUN_TestServers(entry.localAddress, m_servers.c_str());
        if (index < 0) {
            index = 0;  // nobody answered: the first server gets the full test anyway
        }
        if (platform::CurrentThreadStopRequested()) {
            return false;
        }
        char token[kServerTokenSize] = {};
        GetListToken(m_servers.c_str(), index, token, sizeof token);
        uint32_t server = 0;
        if (token[0] != '\0' && ResolveSTUNServer(token, /*logErrors=*/true, server)) {
            STUN_GetResult(server, kSTUNPort, entry);
            if (platform::CurrentThreadStopRequested()) {
                return false;
            }
        }
        list.entries[i] = entry;
    }
    return !platform::CurrentThreadStopRequested();
}

}  // namespace stun
