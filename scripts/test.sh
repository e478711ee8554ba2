#!/usr/bin/env bash
# Installs the dependencies, builds with warnings as errors and runs the whole
# suite twice: plainly, then under AddressSanitizer and UndefinedBehaviorSanitizer.
set -euo pipefail
cd "$(dirname "$0")/.."

jobs=$(nproc 2>/dev/null || echo 2)
step() { printf '\n==> %s\n' "$*"; }
fail() { printf '\ntest.sh: %s\n' "$*" >&2; exit 1; }

step "Dependencies"
./scripts/install-deps.sh || fail "installing dependencies failed: run scripts/install-deps.sh as root"

run_suite() {
  local name=$1; shift
  local dir=build/$name
  step "Configure ($name)"
  cmake -S . -B "$dir" -G Ninja -DZEPA_WERROR=ON "$@" >/dev/null || fail "cmake configure of $dir failed"
  step "Build ($name)"
  cmake --build "$dir" -j "$jobs" || fail "build of $dir failed (see the compiler output above)"
  step "Test ($name)"
  (cd "$dir" && ctest -j "$jobs" --output-on-failure --timeout 300) || fail "tests failed in $dir (output above)"
}

run_suite plain -DCMAKE_BUILD_TYPE=RelWithDebInfo
ASAN_OPTIONS=detect_leaks=1:abort_on_error=1 UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1 \
  run_suite sanitize -DCMAKE_BUILD_TYPE=Debug -DZEPA_SANITIZE=ON -DZEPA_BUILD_BENCH=OFF
step "All tests passed, plainly and under ASan+UBSan"
