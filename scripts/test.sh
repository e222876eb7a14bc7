#!/usr/bin/env bash
# Builds keymgr with its tests in a sandbox root and runs the whole suite.
#   scripts/test.sh              normal build in build/, root /tmp/keymgr-test
#   scripts/test.sh --sanitize   AddressSanitizer + UBSan build in build-asan/,
#                                root /tmp/keymgr-test-asan
#   scripts/test.sh --tsan       ThreadSanitizer build in build-tsan/, root
#                                /tmp/keymgr-test-tsan: the tests that run the
#                                boot verification's hashing threads
#   scripts/test.sh --target aarch64|armhf
#                                cross build in build-TARGET/ against the target's
#                                Debian libraries (build-TARGET/sysroot), tests
#                                run under qemu-user, root /tmp/keymgr-test-TARGET
#   scripts/test.sh --vm         the aarch64 device build booted on an ARM kernel
#                                under qemu-system (scripts/vm-test.sh)
# KEYMGR_TEST_ROOT overrides the sandbox root (at most 35 characters; --sanitize
# and --tsan add -asan and -tsan to it).
set -euo pipefail
cd "$(dirname "$0")/.."

usage() {
  echo "usage: $0 [--sanitize | --tsan | --target aarch64|armhf | --vm]" >&2
  exit 2
}

sudo=""
[ "$(id -u)" -eq 0 ] || sudo="sudo"

# binfmt_misc lets the kernel start the target's programs through qemu, as a
# person starting them by hand expects. The suite does not need it: its tests
# start them under qemu themselves.
register_binfmt() {
  local cpu=$1 dir=/proc/sys/fs/binfmt_misc
  [ -e "$dir/register" ] || $sudo mount -t binfmt_misc binfmt_misc "$dir" 2>/dev/null || true
  if [ ! -e "$dir/qemu-$cpu" ] && [ -e "$dir/register" ]; then
    $sudo tee "$dir/register" </usr/lib/binfmt.d/"qemu-$cpu.conf" >/dev/null 2>&1 || true
  fi
  if grep -qx enabled "$dir/qemu-$cpu" 2>/dev/null; then
    echo "binfmt_misc starts $cpu programs; run one by hand as" \
      "QEMU_LD_PREFIX=$build/sysroot PROGRAM"
  else
    echo "note: binfmt_misc does not start $cpu programs here (it cannot be mounted, or" \
      "qemu registered, without privilege, as in an unprivileged container; or the entry" \
      "is disabled); the tests do not need it. To start $cpu programs directly, register" \
      "qemu-user-static on the host as root" \
      "(systemctl restart systemd-binfmt, or update-binfmts --enable qemu-$cpu with" \
      "binfmt-support), or run one as qemu-$cpu-static -L $build/sysroot PROGRAM"
  fi
}

build=build
root=${KEYMGR_TEST_ROOT:-/tmp/keymgr-test}
extra=()
targets=()
tests=()
case "${1:-}" in
  "") ;;
  --sanitize)
    build="build-asan"
    root=${KEYMGR_TEST_ROOT:-/tmp/keymgr-test}-asan
    extra=(-DKEYMGR_SANITIZE=ON -DCMAKE_BUILD_TYPE=Debug)
    export ASAN_OPTIONS=detect_leaks=1:abort_on_error=1:strict_string_checks=1
    export UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1
    ;;
  --tsan)
    build="build-tsan"
    root=${KEYMGR_TEST_ROOT:-/tmp/keymgr-test}-tsan
    extra=(-DKEYMGR_TSAN=ON)
    targets=(--target cli_test tools_mkdigest_test)
    tests=(-L threads)
    export TSAN_OPTIONS=halt_on_error=1:second_deadlock_stack=1
    ;;
  --target)
    build=build-${2:-}
    root=${KEYMGR_TEST_ROOT:-/tmp/keymgr-test-${2:-}}
    # cross-setup.sh installs what every job needs, with the cross compiler.
    echo "== installing what the tests need, the ${2:-} cross compiler and the target's libraries =="
    # shellcheck source=scripts/cross-setup.sh
    . scripts/cross-setup.sh "${2:-}" "$build"
    extra=("${cross_args[@]}")
    register_binfmt "$cpu"
    ;;
  --vm) exec bash scripts/vm-test.sh ;;
  *) usage ;;
esac
if [ -z "${cross_args:-}" ]; then
  echo "== installing what the tests need =="
  bash scripts/install-deps.sh test
fi

# The suite installs tests/kmm/data/dmsetup as the disk-mapper tool, so the
# build expects that file's digest.
dmsetup_sha256=$(sha256sum tests/kmm/data/dmsetup | cut -d" " -f1)

echo "== configuring $build/ (sandbox root $root) =="
cmake -S . -B "$build" -G Ninja -DKEYMGR_ROOT="$root" -DKEYMGR_DMSETUP_SHA256="$dmsetup_sha256" \
  "${extra[@]}"
echo "== building =="
cmake --build "$build" -j "$(nproc)" "${targets[@]}"
cd "$build"
echo "== running $(ctest -N "${tests[@]}" | sed -n 's/^Total Tests: //p') tests =="
if grep -q '^KEYMGR_HARDENING_CHECK:FILEPATH=.*NOTFOUND' CMakeCache.txt; then
  echo "   (hardening_check is skipped: hardening-check, from devscripts, is not installed;" \
    "bash scripts/install-deps.sh test devscripts adds it)"
fi
ctest --output-on-failure -j "$(nproc)" "${tests[@]}"
