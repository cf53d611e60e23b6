#include "foundation/Logger.h"

#include <atomic>
#include <cstdarg>
#include <memory>
#include <vector>

#include "platform/fs.h"
#include "platform/kernel.h"
#include "platform/modulelock.h"

namespace foundation {

namespace {
constexpr const char* kModuleTag = "NqPrtMan";

// Cuts at most `limit` bytes without splitting a UTF-8 sequence.
size_t Utf8Cut(const char* text, size_t length, size_t limit) {
    if (length <= limit) {
        return length;
    }
    size_t cut = limit;
    while (cut > 0 && (static_cast<unsigned char>(text[cut]) & 0xC0) == 0x80) {
        --cut;
    }
    return cut;
}
}  // namespace

namespace {

std::atomic<LogMsg*> g_logger{nullptr};

// The logger outlives static destruction while objects live, so that their worker threads may
// still log during process exit. With none left (the module unloading, or a clean exit) no thread
// of ours can log, and it goes with its file: a module loaded and unloaded again leaks nothing.
struct LoggerEnd {
    ~LoggerEnd() {
        if (platform::ModuleLockCount() == 0) {
            delete g_logger.exchange(nullptr);
        }
    }
} g_loggerEnd;

}  // namespace

LogMsg& Logger() {
    LogMsg* logger = g_logger.load(std::memory_order_acquire);
    if (logger == nullptr) {
        std::unique_ptr<LogMsg> made(new LogMsg());
        if (g_logger.compare_exchange_strong(logger, made.get(), std::memory_order_acq_rel)) {
            logger = made.release();
        }
    }
    return *logger;
}

LogMsg::~LogMsg() {
    if (file_ != nullptr) {
        std::fclose(file_);
    }
}

const char* LogMsg::LevelText(int level) {
    switch (level) {
        case kLogError:
            return "ERROR";
        case kLogWarn:
            return "WARN ";
        case kLogInfo:
            return "INFO ";
        case kLogDebug:
            return "DEBUG";
        case kLogTrace:
            return "TRACE";
        default:
            return "UNKN ";
    }
}

void LogMsg::Initialize(std::optional<std::string> folder, std::optional<std::string> prefix,
                        std::optional<std::string> extension, int level, bool enabled) {
    level_.store(level);
    enabled_.store(enabled);
    {
        std::lock_guard<std::mutex> lock(mutex_);
        folder_ = std::move(folder);
        prefix_ = std::move(prefix);
        extension_ = std::move(extension);
    }
    Log("LogMsg::Initialize", kLogInfo, "%s", "Completed");
}

void LogMsg::Log(const char* function, int level, const char* format, ...) {
    if (!IsEnabledFor(level)) {
        return;
    }
    va_list args;
    va_start(args, format);
    Write(function, level, format, args);
    va_end(args);
}

void LogMsg::Trace(const char* function, const char* format, ...) {
    if (!IsEnabledFor(kLogTrace)) {
        return;
    }
    va_list args;
    va_start(args, format);
    Write(function, kLogTrace, format, args);
    va_end(args);
}

void LogMsg::Write(const char* function, int level, const char* format, va_list args) {
    std::vector<char> message(kMaxLogMessage + 1);
    va_list copy;
    va_copy(copy, args);
    const int needed = std::vsnprintf(message.data(), message.size(), format, copy);
    va_end(copy);
    if (needed <= 0) {
        return;  // an empty message or a formatting error writes nothing
    }
    std::string text;
    if (static_cast<size_t>(needed) > kMaxLogMessage) {
        std::vector<char> full(static_cast<size_t>(needed) + 1);
        std::vsnprintf(full.data(), full.size(), format, args);
        text.assign(full.data(), Utf8Cut(full.data(), static_cast<size_t>(needed), kMaxLogMessage));
    } else {
        text.assign(message.data(), static_cast<size_t>(needed));
    }
    text += '\n';

    const platform::LocalTime t = platform::GetLocalTime();
    const std::string indentation;  // nesting depth is never set, so always empty
    char head[96];
    std::snprintf(head, sizeof head, "%02d:%02d:%02d.%03d, %06u, %-8s, %s, ", t.hour, t.minute,
                  t.second, t.milliseconds, platform::GetCurrentThreadId(), kModuleTag,
                  LevelText(level));
    std::string line = head;
    line += indentation;
    line += function != nullptr ? function : "";
    line += ' ';
    line += text;

    platform::OutputDebugString(line);

    std::lock_guard<std::mutex> lock(mutex_);
    if (file_ == nullptr) {
        const std::string name = CurrentFileNameLocked(t);
        if (!name.empty()) {
            file_ = platform::OpenAppend(name);
        }
    }
    if (file_ != nullptr) {
        std::fputs(line.c_str(), file_);
        std::fflush(file_);
    }
}

std::string LogMsg::CurrentFileName() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return CurrentFileNameLocked(platform::GetLocalTime());
}

std::string LogMsg::CurrentFileNameLocked(const platform::LocalTime& t) const {
    if (!folder_.has_value() || folder_->empty()) {
        return {};
    }
    char date[32];
    std::snprintf(date, sizeof date, "-%04d-%02d-%02d", t.year, t.month, t.day);
    return *folder_ + platform::kPathSeparator + prefix_.value_or("") + date +
           extension_.value_or("");
}

void LogMsg::Close() {
    std::lock_guard<std::mutex> lock(mutex_);
    if (file_ != nullptr) {
        std::fclose(file_);
        file_ = nullptr;
    }
}

std::optional<std::string> LogMsg::Folder() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return folder_;
}

std::optional<std::string> LogMsg::Prefix() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return prefix_;
}

std::optional<std::string> LogMsg::Extension() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return extension_;
}

}  // namespace foundation
