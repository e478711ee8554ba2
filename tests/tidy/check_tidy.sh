#!/usr/bin/env bash
# usage: check_tidy.sh CLANG_TIDY SOURCE_DIR BUILD_DIR
# Runs clang-tidy with the repository's .clang-tidy (naming of our own
# identifiers and a few bug checks) over the library's sources, two at a time.
set -euo pipefail
tidy=$1
src=$2
build=$3
[ -f "$build/compile_commands.json" ] || {
  echo "check_tidy: $build/compile_commands.json is missing; configure with CMAKE_EXPORT_COMPILE_COMMANDS=ON" >&2
  exit 1
}
mapfile -t files < <(find "$src/src" -name '*.cpp' | sort)
echo "check_tidy: ${#files[@]} files of src/"
if ! printf '%s\n' "${files[@]}" | xargs -P 2 -n 4 "$tidy" -p "$build" --quiet 2>/dev/null; then
  echo "check_tidy: clang-tidy found problems above; fix the names (see .clang-tidy) or the code" >&2
  exit 1
fi
echo "check_tidy: clean"
