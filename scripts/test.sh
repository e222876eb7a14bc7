#!/usr/bin/env bash
# Builds keymgr with its tests in a sandbox root and runs the whole suite.
#   scripts/test.sh              normal build in build/, root /tmp/keymgr-test
#   scripts/test.sh --sanitize   AddressSanitizer + UBSan build in build-asan/,
#                                root /tmp/keymgr-test-asan
#   scripts/test.sh --tsan       ThreadSanitizer build in build-tsan/, root
#                                /tmp/keymgr-test-tsan
# KEYMGR_TEST_ROOT overrides the sandbox root (at most 35 characters).
set -euo pipefail
cd "$(dirname "$0")/.."
bash scripts/install-deps.sh

build=build
root=${KEYMGR_TEST_ROOT:-/tmp/keymgr-test}
extra=()
case "${1:-}" in
  --sanitize)
    build=build-asan
    root=${KEYMGR_TEST_ROOT:-/tmp/keymgr-test}-asan
    extra=(-DKEYMGR_SANITIZE=ON -DCMAKE_BUILD_TYPE=Debug)
    export ASAN_OPTIONS=detect_leaks=1:abort_on_error=1:strict_string_checks=1
    export UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1
    ;;
  --tsan)
    build=build-tsan
    root=${KEYMGR_TEST_ROOT:-/tmp/keymgr-test}-tsan
    extra=(-DKEYMGR_TSAN=ON)
    export TSAN_OPTIONS=halt_on_error=1:second_deadlock_stack=1
    ;;
esac

# The suite installs tests/kmm/data/dmsetup as the disk-mapper tool, so the
# build expects that file's digest.
dmsetup_sha256=$(sha256sum tests/kmm/data/dmsetup | cut -d" " -f1)

cmake -S . -B "$build" -G Ninja -DKEYMGR_ROOT="$root" -DKEYMGR_DMSETUP_SHA256="$dmsetup_sha256" \
  "${extra[@]}"
cmake --build "$build" -j "$(nproc)"
cd "$build"
ctest --output-on-failure -j "$(nproc)"
