#include "platform/fs.h"

namespace platform {

std::FILE* OpenAppend(const std::string& path) {
    return std::fopen(path.c_str(), "a+e");
}

}  // namespace platform
