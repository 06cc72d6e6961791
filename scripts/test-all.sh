#!/usr/bin/env bash
# The whole test suite, as CI runs it: installs what is missing, then builds
# and tests three configurations:
#   build/       GCC, RelWithDebInfo, warnings as errors: every test
#   build-asan/  GCC, AddressSanitizer + UndefinedBehaviorSanitizer: every test
#   build-tsan/  Clang, ThreadSanitizer: the concurrency tests
set -euo pipefail
cd "$(dirname "$0")/.."
root=$(pwd)

scripts/setup-debian.sh

jobs=$(nproc 2>/dev/null || echo 2)
export CTEST_OUTPUT_ON_FAILURE=1
# Tests write their temporary folders on the real file system of the build
# folder, not on a RAM file system where O_DIRECT is refused.
export ASAN_OPTIONS=detect_leaks=1:abort_on_error=1:detect_stack_use_after_return=1
export UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1
export TSAN_OPTIONS=halt_on_error=1:second_deadlock_stack=1

configure_and_test() {
  local dir=$1 label=$2 target=$3; shift 3
  echo "=== ${dir}: configure"
  cmake -S "$root" -B "$root/$dir" -G Ninja -DRK_WARNINGS_AS_ERRORS=ON "$@"
  echo "=== ${dir}: build"
  cmake --build "$root/$dir" -j "$jobs" ${target:+--target "$target"}
  echo "=== ${dir}: test"
  (cd "$root/$dir" && RK_TEST_TMPDIR="$root/$dir/test-tmp" ctest -j "$jobs" --timeout 300 ${label:+-L "$label"})
}

configure_and_test build "" "" -DCMAKE_BUILD_TYPE=RelWithDebInfo
configure_and_test build-asan "" "" -DCMAKE_BUILD_TYPE=Debug -DRK_SANITIZE=address -DRK_BUILD_BENCH=OFF
configure_and_test build-tsan concurrency rk_concurrency_tests -DCMAKE_BUILD_TYPE=RelWithDebInfo -DRK_SANITIZE=thread \
  -DCMAKE_CXX_COMPILER=clang++ -DRK_BUILD_BENCH=OFF -DRK_BUILD_TOOLS=OFF

echo "=== all test builds passed"
