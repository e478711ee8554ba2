#!/usr/bin/env bash
# usage: check_stub_sdk.sh BUILD_DIR STUB_LIBRARY FUNCTION_LIST
# The library must link (with --no-undefined) against a platform library that
# offers only the listed platform functions: builds that link and checks that
# the stub exports exactly the list.
set -euo pipefail
build=$1
stub=$2
list=$3

grep -v '^#' "$list" | sed '/^$/d' | sort > "$build/stub_sdk_expected.txt"
echo "== linking libzeparelayd against the stub platform library"
if ! cmake --build "$build" --target zeparelayd_on_stub_sdk; then
  echo "check_stub_sdk: libzeparelayd calls a platform function the appliance does not offer;" >&2
  echo "check_stub_sdk: use only the functions of $list" >&2
  exit 1
fi
nm -D --defined-only "$stub" | awk '{print $3}' | sort > "$build/stub_sdk_exported.txt"
if ! diff -u "$build/stub_sdk_expected.txt" "$build/stub_sdk_exported.txt"; then
  echo "check_stub_sdk: the stub exports something else than the platform functions" >&2
  exit 1
fi
echo "check_stub_sdk: linked against $(wc -l < "$build/stub_sdk_expected.txt") platform functions"
