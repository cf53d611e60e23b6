#include "platform/fs.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

namespace platform {

namespace {

std::string Reason(const std::string& what, const std::string& path) {
    return what + " " + path + ": " + std::strerror(errno);
}

// Every missing folder of the path's parent, as mkdir -p would.
bool MakeParents(const std::string& path, std::string& error) {
    for (size_t slash = path.find('/', 1); slash != std::string::npos;
         slash = path.find('/', slash + 1)) {
        const std::string folder = path.substr(0, slash);
        if (mkdir(folder.c_str(), 0755) != 0 && errno != EEXIST) {
            error = Reason("cannot create", folder);
            return false;
        }
    }
    return true;
}

bool WriteAll(int fd, const std::string& contents) {
    size_t done = 0;
    while (done < contents.size()) {
        const ssize_t n = write(fd, contents.data() + done, contents.size() - done);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            return false;
        }
        done += static_cast<size_t>(n);
    }
    return true;
}

}  // namespace

std::FILE* OpenAppend(const std::string& path) {
    return std::fopen(path.c_str(), "a+e");
}

bool ReadWholeFile(const std::string& path, std::string& contents, std::string& error,
                   bool& missing) {
    contents.clear();
    const int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    missing = fd < 0 && errno == ENOENT;
    if (fd < 0) {
        error = Reason("cannot open", path);
        return false;
    }
    char buffer[8192];
    for (;;) {
        const ssize_t n = read(fd, buffer, sizeof buffer);
        if (n > 0) {
            contents.append(buffer, static_cast<size_t>(n));
        } else if (n == 0) {
            break;
        } else if (errno != EINTR) {
            error = Reason("cannot read", path);
            close(fd);
            return false;
        }
    }
    close(fd);
    return true;
}

bool ReplaceFile(const std::string& path, const std::string& contents, std::string& error) {
    if (!MakeParents(path, error)) {
        return false;
    }
    std::string temporary = path + ".XXXXXX";
    const int fd = mkostemp(temporary.data(), O_CLOEXEC);
    if (fd < 0) {
        error = Reason("cannot create a temporary file for", path);
        return false;
    }
    bool ok = WriteAll(fd, contents) && fchmod(fd, 0644) == 0 && fsync(fd) == 0;
    if (!ok) {
        error = Reason("cannot write", temporary);
    }
    if (close(fd) != 0 && ok) {
        ok = false;
        error = Reason("cannot write", temporary);
    }
    if (ok && rename(temporary.c_str(), path.c_str()) != 0) {
        ok = false;
        error = Reason("cannot replace", path);
    }
    if (!ok) {
        unlink(temporary.c_str());
    }
    return ok;
}

FileLock::FileLock(const std::string& path) {
    const std::string lockPath = path + ".lock";
    if (!MakeParents(lockPath, error_)) {
        return;
    }
    fd_ = open(lockPath.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
    if (fd_ < 0) {
        error_ = Reason("cannot open", lockPath);
        return;
    }
    // Held only for a read, an edit in memory and a write: a plain blocking wait.
    while (flock(fd_, LOCK_EX) != 0) {
        if (errno != EINTR) {
            error_ = Reason("cannot lock", lockPath);
            close(fd_);
            fd_ = -1;
            return;
        }
    }
}

FileLock::~FileLock() {
    if (fd_ >= 0) {
        close(fd_);  // releases the lock
    }
}

std::string EnvironmentValue(const char* name) {
    const char* value = std::getenv(name);
    return value != nullptr ? value : "";
}

bool SetEnvironmentValue(const char* name, const std::string& value) {
    return setenv(name, value.c_str(), 1) == 0;
}

std::string UserDataFolder() {
    const std::string xdg = EnvironmentValue("XDG_DATA_HOME");
    if (!xdg.empty() && xdg.front() == '/') {  // relative values are ignored, as XDG says
        return xdg;
    }
    const std::string home = EnvironmentValue("HOME");
    return home.empty() ? std::string() : home + "/.local/share";
}

}  // namespace platform
