#include "platform/fs.h"

#include <windows.h>

#include <cstdlib>

#include "platform/win32/handle.h"

namespace platform {

namespace {

std::string Reason(const std::string& what, const std::string& path) {
    return what + " " + path + ": " + SystemErrorText(GetLastError());
}

bool IsSeparator(char c) {
    return c == '\\' || c == '/';
}

// Every missing folder of the path's parent. A drive ("C:") or share root is skipped.
bool MakeParents(const std::string& path, std::string& error) {
    for (size_t at = 1; at < path.size(); ++at) {
        if (!IsSeparator(path[at]) || path[at - 1] == ':' || IsSeparator(path[at - 1])) {
            continue;
        }
        const std::string folder = path.substr(0, at);
        if (!CreateDirectoryW(Wide(folder).c_str(), nullptr) &&
            GetLastError() != ERROR_ALREADY_EXISTS) {
            error = Reason("cannot create", folder);
            return false;
        }
    }
    return true;
}

}  // namespace

std::FILE* OpenAppend(const std::string& path) {
    // N: not inherited by child processes.
    return _wfopen(Wide(path).c_str(), L"a+N");
}

bool ReadWholeFile(const std::string& path, std::string& contents, std::string& error,
                   bool& missing) {
    contents.clear();
    HANDLE file = CreateFileW(Wide(path).c_str(), GENERIC_READ,
                              FILE_SHARE_READ | FILE_SHARE_WRITE | FILE_SHARE_DELETE, nullptr,
                              OPEN_EXISTING, FILE_ATTRIBUTE_NORMAL, nullptr);
    if (file == INVALID_HANDLE_VALUE) {
        const DWORD e = GetLastError();
        missing = e == ERROR_FILE_NOT_FOUND || e == ERROR_PATH_NOT_FOUND;
        error = Reason("cannot open", path);
        return false;
    }
    missing = false;
    char buffer[8192];
    for (;;) {
        DWORD n = 0;
        if (!ReadFile(file, buffer, sizeof buffer, &n, nullptr)) {
            error = Reason("cannot read", path);
            CloseHandle(file);
            return false;
        }
        if (n == 0) {
            break;
        }
        contents.append(buffer, n);
    }
    CloseHandle(file);
    return true;
}

bool ReplaceFile(const std::string& path, const std::string& contents, std::string& error) {
    if (!MakeParents(path, error)) {
        return false;
    }
    const std::string temporary = path + "." + std::to_string(GetCurrentProcessId()) + ".tmp";
    HANDLE file = CreateFileW(Wide(temporary).c_str(), GENERIC_WRITE, 0, nullptr, CREATE_ALWAYS,
                              FILE_ATTRIBUTE_NORMAL, nullptr);
    if (file == INVALID_HANDLE_VALUE) {
        error = Reason("cannot create a temporary file for", path);
        return false;
    }
    bool ok = true;
    size_t done = 0;
    while (ok && done < contents.size()) {
        const size_t left = contents.size() - done;
        DWORD n = 0;
        ok = WriteFile(file, contents.data() + done,
                       static_cast<DWORD>(left > 0x10000000 ? 0x10000000 : left), &n, nullptr) &&
             n > 0;
        done += n;
    }
    ok = ok && FlushFileBuffers(file);
    if (!ok) {
        error = Reason("cannot write", temporary);
    }
    CloseHandle(file);
    if (ok && !MoveFileExW(Wide(temporary).c_str(), Wide(path).c_str(),
                           MOVEFILE_REPLACE_EXISTING | MOVEFILE_WRITE_THROUGH)) {
        ok = false;
        error = Reason("cannot replace", path);
    }
    if (!ok) {
        DeleteFileW(Wide(temporary).c_str());
    }
    return ok;
}

FileLock::FileLock(const std::string& path) {
    const std::string lockPath = path + ".lock";
    if (!MakeParents(lockPath, error_)) {
        return;
    }
    HANDLE file = CreateFileW(Wide(lockPath).c_str(), GENERIC_READ | GENERIC_WRITE,
                              FILE_SHARE_READ | FILE_SHARE_WRITE, nullptr, OPEN_ALWAYS,
                              FILE_ATTRIBUTE_NORMAL, nullptr);
    if (file == INVALID_HANDLE_VALUE) {
        error_ = Reason("cannot open", lockPath);
        return;
    }
    // Held only for a read, an edit in memory and a write: a plain blocking wait.
    OVERLAPPED whole{};
    if (!LockFileEx(file, LOCKFILE_EXCLUSIVE_LOCK, 0, MAXDWORD, MAXDWORD, &whole)) {
        error_ = Reason("cannot lock", lockPath);
        CloseHandle(file);
        return;
    }
    fd_ = DescriptorOf(file);
}

FileLock::~FileLock() {
    if (fd_ >= 0) {
        CloseHandle(HandleOf(fd_));  // releases the lock
    }
}

std::string EnvironmentValue(const char* name) {
    const std::wstring wideName = Wide(name);
    const DWORD size = GetEnvironmentVariableW(wideName.c_str(), nullptr, 0);
    if (size == 0) {
        return {};
    }
    std::wstring value(size, L'\0');
    const DWORD n = GetEnvironmentVariableW(wideName.c_str(), value.data(), size);
    value.resize(n < size ? n : 0);
    return Utf8(value);
}

bool SetEnvironmentValue(const char* name, const std::string& value) {
    // Both the process block (children, GetEnvironmentVariable) and the C runtime's copy.
    return SetEnvironmentVariableW(Wide(name).c_str(), Wide(value).c_str()) &&
           _wputenv_s(Wide(name).c_str(), Wide(value).c_str()) == 0;
}

std::string UserDataFolder() {
    return EnvironmentValue("LOCALAPPDATA");
}

}  // namespace platform
