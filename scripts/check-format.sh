#!/bin/sh
# Fails when a C or C++ source of the project differs from what clang-format
# makes of it with the project's .clang-format (generated files excluded).
set -eu
ROOT=$(cd "$(dirname "$0")/.." && pwd)
cd "$ROOT"
files=$(git ls-files '*.cpp' '*.h' '*.c')
if ! clang-format --dry-run --Werror $files; then
    echo "clang-format: the files above need formatting (clang-format -i FILE)" >&2
    exit 1
fi
echo "clang-format: $(echo "$files" | wc -l) files clean"
