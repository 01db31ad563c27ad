#!/usr/bin/env bash
# The benchmark: builds in release mode (build-release/), starts the test domain server and cache-kest
# in a temporary root and prints one table of p50 and p90 latencies, each against its floor measured in
# the same run. Run as root on an otherwise idle machine; it takes about a minute.
set -euo pipefail
top=$(cd "$(dirname "$0")/.." && pwd)
. "$top/tools/deps.sh"
kest_ensure_packages

build="$top/build-release"
cmake -S "$top" -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=Release >/dev/null
cmake --build "$build" --parallel "$(nproc)" --target kest-bench
KEST_TEST_BINARY_DIR="$build" "$build/bench/kest-bench"
