#!/usr/bin/env bash
# package_test.sh BUILD_DIR [EMULATOR...]: builds the Debian package of the
# build, checks that it is for the architecture the build's C compiler
# (KEYMGR_CC) targets and that its Depends were generated, unpacks it into a
# scratch root and runs keymgr -v from there, under the EMULATOR of a cross
# build.
set -euo pipefail
# shellcheck source=tests/dist/common.sh
. "$(dirname "$0")/common.sh" package-test "$@"
(cd "$work" && cpack -G DEB --config "$build/CPackConfig.cmake" >/dev/null)
deb=$(ls "$work"/keymgr_*.deb)
arch=$(dpkg-deb -f "$deb" Architecture)
target=$("${KEYMGR_CC:-cc}" -dumpmachine)
[ "$(CC=${KEYMGR_CC:-cc} dpkg-architecture -a"$arch" -qDEB_HOST_GNU_TYPE)" = "$target" ] ||
  fail "a package for $arch holds programs for $target"
depends=$(dpkg-deb -f "$deb" Depends)
echo "$(basename "$deb"): Depends: $depends"
for library in libc6 libssl3 libtss2-esys; do
  grep -q "$library" <<<"$depends" || fail "Depends lacks $library"
done
dpkg -x "$deb" "$work/root"
version=$("${emulator[@]}" "$(find "$work/root" -path '*/bin/keymgr')" -v)
[ "$version" = "Version: 2.3" ] || fail "keymgr -v printed: $version"
echo "package checked"
