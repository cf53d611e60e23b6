#!/usr/bin/env bash
# Fails when a C++ file of the repository is not formatted as .clang-format says.
set -u
cd "${1:-$(dirname "$0")/..}" || exit 2
files=$(git ls-files --cached --others --exclude-standard -- '*.h' '*.hpp' '*.cpp' '*.cc' |
        grep -v -E '^build')
# shellcheck disable=SC2086
clang-format --dry-run --Werror $files && echo "formatting ok"
