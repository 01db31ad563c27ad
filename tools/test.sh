#!/usr/bin/env bash
# Builds kest-iam and runs every test. Installs the build dependencies first when they are missing.
#   tools/test.sh               plain build in build/
#   tools/test.sh --sanitize    AddressSanitizer + UndefinedBehaviorSanitizer build in build-asan/
set -euo pipefail
top=$(cd "$(dirname "$0")/.." && pwd)
. "$top/tools/deps.sh"

sanitize=OFF
build="$top/build"
for argument in "$@"; do
    case "$argument" in
    --sanitize) sanitize=ON; build="$top/build-asan" ;;
    *) echo "usage: $0 [--sanitize]" >&2; exit 2 ;;
    esac
done

kest_ensure_packages

cmake -S "$top" -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo -DKEST_WERROR=ON -DKEST_SANITIZE="$sanitize"
cmake --build "$build" --parallel "$(nproc)"
export ASAN_OPTIONS=${ASAN_OPTIONS:-detect_leaks=1}
export UBSAN_OPTIONS=${UBSAN_OPTIONS:-print_stacktrace=1:halt_on_error=1}
cd "$build"
status=0
ctest --output-on-failure --parallel "$(nproc)" --timeout 600 || status=$?
# ctest shows no output of a skipped test: its reason, then.
grep -h '^SKIP: ' Testing/Temporary/LastTest.log 2>/dev/null || true
exit "$status"
