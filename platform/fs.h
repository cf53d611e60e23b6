// Files: the logger's append stream, and whole-file reads and replacements for the registry.
#pragma once

#include "platform/system_names.h"

#include <cstdio>
#include <string>

namespace platform {

#ifdef _WIN32
inline constexpr char kPathSeparator = '\\';
#else
inline constexpr char kPathSeparator = '/';
#endif

// Opens for appending in text mode, creating the file; null on failure. Not inherited by
// child processes.
std::FILE* OpenAppend(const std::string& path);

// The whole file. False with the reason in error when it cannot be read; missing tells whether
// it does not exist at all.
bool ReadWholeFile(const std::string& path, std::string& contents, std::string& error,
                   bool& missing);

// Replaces the file with contents, creating missing parent folders: written to a temporary file
// beside it, flushed to disk and renamed over it, so that a reader sees the old file or the new
// one and never a part.
bool ReplaceFile(const std::string& path, const std::string& contents, std::string& error);

// An exclusive lock on PATH.lock while the object lives, shared with other processes.
class FileLock {
  public:
    explicit FileLock(const std::string& path);
    ~FileLock();
    FileLock(const FileLock&) = delete;
    FileLock& operator=(const FileLock&) = delete;

    bool IsHeld() const { return fd_ >= 0; }
    const std::string& Error() const { return error_; }

  private:
    int fd_ = -1;
    std::string error_;
};

// The user's data folder: $XDG_DATA_HOME, else $HOME/.local/share; empty when neither is set.
std::string UserDataFolder();
// The value of an environment variable, empty when it is not set.
std::string EnvironmentValue(const char* name);
// Sets it for this process and the children it starts.
bool SetEnvironmentValue(const char* name, const std::string& value);

}  // namespace platform
