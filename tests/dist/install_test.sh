#!/usr/bin/env bash
# install_test.sh BUILD_DIR [EMULATOR...]: installs the build into a scratch
# root and checks what others build on: a C host built with pkg-config and with
# find_package(kmm), each against the shared and the static library; the man
# pages; the boot unit and the init script.
# The hosts are built with the build's C compiler (KEYMGR_CC) and toolchain
# file (KEYMGR_TOOLCHAIN). A cross build also gives its sysroot
# (KEYMGR_SYSROOT) and its emulator: the scratch root is then a staging
# sysroot, the target's libraries with the build installed into it, as a
# firmware integrator builds against; the hosts run under the emulator. The
# man pages, the unit and the script are checked natively either way.
set -euo pipefail
here=$(cd "$(dirname "$0")" && pwd)
# shellcheck source=tests/dist/common.sh
. "$here/common.sh" install-test "$@"
cc=${KEYMGR_CC:-cc}
sysroot=${KEYMGR_SYSROOT:-}
prefix=$(sed -n 's/^CMAKE_INSTALL_PREFIX:[A-Z]*=//p' "$build/CMakeCache.txt")
root=$work/root
if [ -n "$sysroot" ]; then
  mkdir -p "$root"
  cp -as "$(cd "$sysroot" && pwd)/." "$root"
  # The hosts run on the staging sysroot's libraries: the CMake host's run
  # path, /usr/local/lib, is one on the device.
  emulator=("${emulator[@]/#"$sysroot"/$root}")
fi
DESTDIR=$root cmake --install "$build" >/dev/null
tree=$root$prefix
lib=$tree/$(sed -n 's/^CMAKE_INSTALL_LIBDIR:[A-Z]*=//p' "$build/CMakeCache.txt")

expected=$'kmm 2.3\nKey manage option invalid(2)!!'
run() {
  local out
  out=$("${emulator[@]}" "$@") || fail "$* exited with $?"
  [ "$out" = "$expected" ] || fail "$*: printed: $out"
}

# pkg-config, shared and static: the static link must not need libkmm.so.
if [ -n "$sysroot" ]; then
  export PKG_CONFIG_SYSROOT_DIR=$root
  multiarch=$("$cc" -print-multiarch)
  export PKG_CONFIG_LIBDIR=$lib/pkgconfig:$root/usr/lib/$multiarch/pkgconfig:$root/usr/share/pkgconfig
  compile=("$cc" --sysroot="$root")
else
  export PKG_CONFIG_PATH=$lib/pkgconfig
  compile=("$cc")
fi
read -ra flags <<<"$(pkg-config --cflags --libs kmm)"
"${compile[@]}" -o "$work/pc-shared" "$here/consumer/consumer.c" "${flags[@]}"
LD_LIBRARY_PATH=$lib run "$work/pc-shared"
read -ra flags <<<"$(pkg-config --cflags kmm) $(pkg-config --static --libs kmm)"
"${compile[@]}" -o "$work/pc-static" "$here/consumer/consumer.c" "${flags[@]/#-lkmm/$lib/libkmm.a}"
! readelf -d "$work/pc-static" | grep -q 'NEEDED.*libkmm' || fail "the static host needs libkmm.so"
run "$work/pc-static"

# CMake's find_package, both targets.
configure=(-DCMAKE_PREFIX_PATH="$tree" -DCMAKE_C_COMPILER="$cc")
if [ -n "${KEYMGR_TOOLCHAIN:-}" ]; then
  configure+=(--toolchain "$KEYMGR_TOOLCHAIN" -DKEYMGR_SYSROOT="$root")
fi
cmake -S "$here/consumer" -B "$work/cmake" "${configure[@]}" >/dev/null
cmake --build "$work/cmake" >/dev/null
run "$work/cmake/consumer_shared"
run "$work/cmake/consumer_static"

# Only the module's C interface is exported.
exported=$(nm -D --defined-only "$lib/libkmm.so" | awk '$2 == "T" { print $3 }' | sort | tr '\n' ' ')
[ "$exported" = "CheckDmsetupDigest KeyManage KmmListKeys KmmPersistSrk KmmSeedRandom " ] ||
  fail "libkmm.so exports: $exported"

# Man pages render without a warning.
for page in "$tree"/share/man/man*/*; do
  warnings=$(groff -ww -z -man "$page" 2>&1)
  [ -z "$warnings" ] || fail "$page: $warnings"
done

# The unit verifies against a root holding the system's own units; the
# script is plain POSIX sh.
mkdir -p "$root/usr/lib/systemd"
cp -r /usr/lib/systemd/system "$root/usr/lib/systemd/"
unit=$(find "$root" -name keymgr-boot.service)
systemd-analyze verify --man=no --root="$root" "$unit"
script=$(find "$root" -path '*init.d/keymgr-boot')
sh -n "$script"
shellcheck -s sh "$script"
echo "install tree checked"
