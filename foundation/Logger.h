// The process-wide logger: every diagnostic line of the component goes to the debugger output
// and, once a folder is configured, to a dated log file.
#pragma once

#include <atomic>
#include <cstdarg>
#include <cstdio>
#include <mutex>
#include <optional>
#include <string>

#include "platform/kernel.h"

namespace foundation {

enum LogLevel : int {
    kLogError = 0,
    kLogWarn = 1,
    kLogInfo = 2,
    kLogDebug = 3,
    kLogTrace = 4,
};

inline constexpr size_t kMaxLogMessage = 4096;

// The C99 formats (%zu, %lld) on every runtime: mingw-w64 builds use its own C99 printf.
#ifdef __MINGW32__
#define NQ_PRINTF_FORMAT(fmt, args) __attribute__((format(gnu_printf, fmt, args)))
#else
#define NQ_PRINTF_FORMAT(fmt, args) __attribute__((format(printf, fmt, args)))
#endif

class LogMsg {
  public:
    // Level, switch and file names as the client set them; a name is absent until set.
    void Initialize(std::optional<std::string> folder, std::optional<std::string> prefix,
                    std::optional<std::string> extension, int level, bool enabled);

    void Log(const char* function, int level, const char* format, ...) NQ_PRINTF_FORMAT(4, 5);
    void Trace(const char* function, const char* format, ...) NQ_PRINTF_FORMAT(3, 4);
    // Closes the file; the next line written opens one again (with that day's date).
    void Close();

    bool IsEnabledFor(int level) const { return enabled_.load() && level <= level_.load(); }
    int Level() const { return level_.load(); }
    void SetLevel(int level) { level_.store(level); }
    bool Enabled() const { return enabled_.load(); }
    void SetEnabled(bool enabled) { enabled_.store(enabled); }
    std::optional<std::string> Folder() const;
    std::optional<std::string> Prefix() const;
    std::optional<std::string> Extension() const;

    // The file name a line written now would open: folder/prefix-YYYY-MM-DD+extension.
    // Empty while no folder is set: then lines go to the debugger output only.
    std::string CurrentFileName() const;

    static const char* LevelText(int level);
    ~LogMsg();

  private:
    friend LogMsg& Logger();
    LogMsg() = default;
    void Write(const char* function, int level, const char* format, va_list args);
    std::string CurrentFileNameLocked(const platform::LocalTime& t) const;

    mutable std::mutex mutex_;  // the file and the names; lines of threads never interleave
    std::FILE* file_ = nullptr;
    std::optional<std::string> folder_;
    std::optional<std::string> prefix_;
    std::optional<std::string> extension_;
    std::atomic<int> level_{0};
    std::atomic<bool> enabled_{false};
};

// The one logger of the process (of the module), created on first use; it is destroyed only when
// no object of the module is left.
LogMsg& Logger();

}  // namespace foundation

// "Entered..." trace of a public method, under its qualified name.
#define NQ_TRACE_ENTERED(function) ::foundation::Logger().Trace(function, "%s", "Entered...")
#define NQ_LOG(function, level, ...) ::foundation::Logger().Log(function, level, __VA_ARGS__)
