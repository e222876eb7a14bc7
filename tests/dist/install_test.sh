#!/usr/bin/env bash
# install_test.sh BUILD_DIR: installs the build into a scratch root and
# checks what others build on: a C host built with pkg-config and with
# find_package(kmm), each against the shared and the static library; the man
# pages; the boot unit and the init script.
set -euo pipefail
build=$(cd "$1" && pwd)
here=$(cd "$(dirname "$0")" && pwd)
work=$build/install-test
rm -rf "$work"
mkdir -p "$work"
prefix=$(sed -n 's/^CMAKE_INSTALL_PREFIX:[A-Z]*=//p' "$build/CMakeCache.txt")
root=$work/root
DESTDIR=$root cmake --install "$build" >/dev/null
tree=$root$prefix
lib=$tree/$(sed -n 's/^CMAKE_INSTALL_LIBDIR:[A-Z]*=//p' "$build/CMakeCache.txt")

expected=$'kmm 2.3\nKey manage option invalid(2)!!'
fail() { echo "install test: $*" >&2; exit 1; }
run() {
  local out
  out=$("$@") || fail "$* exited with $?"
  [ "$out" = "$expected" ] || fail "$*: printed: $out"
}

# pkg-config, shared and static: the static link must not need libkmm.so.
export PKG_CONFIG_PATH=$lib/pkgconfig
cc -o "$work/pc-shared" "$here/consumer/consumer.c" $(pkg-config --cflags --libs kmm)
LD_LIBRARY_PATH=$lib run "$work/pc-shared"
cc -o "$work/pc-static" "$here/consumer/consumer.c" $(pkg-config --cflags kmm) \
  $(pkg-config --static --libs kmm | sed "s|-lkmm\b|$lib/libkmm.a|")
! ldd "$work/pc-static" | grep -q libkmm || fail "the static host needs libkmm.so"
run "$work/pc-static"

# CMake's find_package, both targets.
cmake -S "$here/consumer" -B "$work/cmake" -DCMAKE_PREFIX_PATH="$tree" >/dev/null
cmake --build "$work/cmake" >/dev/null
run "$work/cmake/consumer_shared"
run "$work/cmake/consumer_static"

# Only the module's C interface is exported.
exported=$(nm -D --defined-only "$lib/libkmm.so" | awk '$2 == "T" { print $3 }' | sort | tr '\n' ' ')
[ "$exported" = "CheckDmsetupDigest KeyManage KmmPersistSrk KmmSeedRandom " ] ||
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
