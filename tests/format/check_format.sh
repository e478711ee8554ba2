#!/usr/bin/env bash
# usage: check_format.sh CLANG_FORMAT SOURCE_DIR
set -euo pipefail
cd "$2"
files=$(find include src sdk tests tools bench fuzz examples -type f \( -name '*.h' -o -name '*.cpp' -o -name '*.c' \) | sort)
if ! "$1" --dry-run -Werror $files; then
  echo "Some files are not formatted: run clang-format -i on them." >&2
  exit 1
fi
echo "$(echo "$files" | wc -l) files formatted"
