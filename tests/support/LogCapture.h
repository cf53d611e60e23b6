// Every line the logger writes, captured for a test and split into its parts; the logger and a
// silent debugger output are restored when the capture ends.
#pragma once

#include <gtest/gtest.h>

#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "foundation/Logger.h"
#include "platform/kernel.h"

namespace testsupport {

// One line of the debugger output, split into its parts.
struct LogLine {
    std::string level;     // "ERROR", "INFO", "DEBUG", "TRACE" (padding removed)
    std::string function;  // the tag the line was logged under
    std::string message;   // the formatted text, without the line's own final newline
};

// Captures every log line at every level; restores the logger and a silent output when done.
class LogCapture {
  public:
    LogCapture()
        : m_folder(foundation::Logger().Folder()),
          m_prefix(foundation::Logger().Prefix()),
          m_extension(foundation::Logger().Extension()),
          m_level(foundation::Logger().Level()),
          m_enabled(foundation::Logger().Enabled()) {
        platform::SetDebugOutputSink([this](std::string_view line) {
            std::lock_guard<std::mutex> lock(m_mutex);
            m_lines.emplace_back(line);
        });
        foundation::Logger().Initialize(std::nullopt, std::nullopt, std::nullopt,
                                        foundation::kLogTrace, true);
        Clear();  // drop the logger's own "Completed" line
    }
    ~LogCapture() {
        platform::SetDebugOutputSink(nullptr);
        foundation::Logger().Initialize(m_folder, m_prefix, m_extension, m_level, m_enabled);
    }
    LogCapture(const LogCapture&) = delete;
    LogCapture& operator=(const LogCapture&) = delete;

    void Clear() {
        std::lock_guard<std::mutex> lock(m_mutex);
        m_lines.clear();
    }

    // "hh:mm:ss.mmm, thread, module, LEVEL, function message\n"
    std::vector<LogLine> Lines() {
        std::lock_guard<std::mutex> lock(m_mutex);
        std::vector<LogLine> parsed;
        for (const std::string& raw : m_lines) {
            size_t at = 0;
            for (int field = 0; field < 3 && at != std::string::npos; ++field) {
                at = raw.find(", ", at);
                at = at == std::string::npos ? at : at + 2;
            }
            const size_t levelEnd = at == std::string::npos ? at : raw.find(", ", at);
            const size_t functionEnd =
                levelEnd == std::string::npos ? levelEnd : raw.find(' ', levelEnd + 2);
            if (functionEnd == std::string::npos || raw.empty() || raw.back() != '\n') {
                ADD_FAILURE() << "unexpected log line: " << raw;
                continue;
            }
            LogLine line;
            line.level = raw.substr(at, levelEnd - at);
            line.level.erase(line.level.find_last_not_of(' ') + 1);
            line.function = raw.substr(levelEnd + 2, functionEnd - levelEnd - 2);
            line.message = raw.substr(functionEnd + 1, raw.size() - functionEnd - 2);
            parsed.push_back(std::move(line));
        }
        return parsed;
    }

    // The lines logged under one tag.
    std::vector<LogLine> LinesOf(const std::string& function) {
        std::vector<LogLine> result;
        for (LogLine& line : Lines()) {
            if (line.function == function) {
                result.push_back(std::move(line));
            }
        }
        return result;
    }

  private:
    std::optional<std::string> m_folder;
    std::optional<std::string> m_prefix;
    std::optional<std::string> m_extension;
    int m_level;
    bool m_enabled;
    std::mutex m_mutex;
    std::vector<std::string> m_lines;
};

}  // namespace testsupport
