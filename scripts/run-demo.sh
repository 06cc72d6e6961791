#!/usr/bin/env bash
# Builds the demo host and runs it: a simulated render host that keeps its
# rendered frames in rkcache. Arguments are passed to the demo (try --help).
set -euo pipefail
cd "$(dirname "$0")/.."
root=$(pwd)

scripts/setup-debian.sh >&2

jobs=$(nproc 2>/dev/null || echo 2)
cmake -S "$root" -B "$root/build-demo" -G Ninja -DCMAKE_BUILD_TYPE=Release \
  -DRK_BUILD_TESTS=OFF -DRK_BUILD_BENCH=OFF >&2
cmake --build "$root/build-demo" -j "$jobs" --target rkdemo >&2
exec "$root/build-demo/tools/rkdemo" "$@"
