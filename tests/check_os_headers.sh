#!/usr/bin/env bash
# Fails when a file outside platform/ and tests/ includes anything but the C++ standard library,
# the project's own headers, the JSON library and the test and benchmark frameworks: only
# platform/ may depend on the operating system, so that another backend can replace it. Tests may
# reach the system directly (namespaces, child processes): no backend ever replaces them.
set -u
root=${1:-$(dirname "$0")/..}
cd "$root" || exit 2
allowed='^(algorithm|any|array|atomic|bit|bitset|cassert|cctype|cerrno|cfloat|charconv|chrono|cinttypes|climits|cmath|compare|concepts|condition_variable|csignal|cstdarg|cstddef|cstdint|cstdio|cstdlib|cstring|ctime|cwchar|cwctype|deque|exception|filesystem|format|forward_list|fstream|functional|future|initializer_list|iomanip|ios|iosfwd|iostream|istream|iterator|limits|list|map|memory|mutex|new|numeric|optional|ostream|queue|random|ranges|ratio|regex|scoped_allocator|set|shared_mutex|source_location|span|sstream|stack|stdexcept|stop_token|streambuf|string|string_view|system_error|thread|tuple|type_traits|typeindex|typeinfo|unordered_map|unordered_set|utility|valarray|variant|vector|version|nqportmanager/.*|nlohmann/.*|gtest/.*|gmock/.*|benchmark/.*)$'
windows_com='^(windows\.h|oaidl\.h|ocidl\.h|olectl\.h)$'
bad=0
while IFS= read -r file; do
    while IFS= read -r line; do
        header=$(sed -E 's/^[[:space:]]*#[[:space:]]*include[[:space:]]*<([^>]+)>.*/\1/' <<<"$line")
        # The public COM headers take the real types from the Windows SDK in the Windows build.
        if [[ $file == include/nqportmanager/* && $header =~ $windows_com ]]; then
            continue
        fi
        if ! [[ $header =~ $allowed ]]; then
            echo "$file: includes <$header>; only platform/ may include system headers"
            bad=1
        fi
    done < <(grep -E '^[[:space:]]*#[[:space:]]*include[[:space:]]*<' "$file")
done < <(git ls-files --cached --others --exclude-standard -- '*.h' '*.hpp' '*.cpp' '*.cc' 2>/dev/null |
         grep -v -E '^(platform/|tests/|build)')
if [ $bad -ne 0 ]; then
    exit 1
fi
echo "no system header outside platform/"
