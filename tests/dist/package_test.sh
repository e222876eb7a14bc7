#!/usr/bin/env bash
# package_test.sh BUILD_DIR: builds the Debian package of the build, checks
# that its Depends were generated, unpacks it into a scratch root and runs
# keymgr -v from there.
set -euo pipefail
build=$(cd "$1" && pwd)
work=$build/package-test
rm -rf "$work"
mkdir -p "$work"
(cd "$work" && cpack -G DEB --config "$build/CPackConfig.cmake" >/dev/null)
deb=$(ls "$work"/keymgr_*.deb)
depends=$(dpkg-deb -f "$deb" Depends)
echo "$(basename "$deb"): Depends: $depends"
for library in libc6 libssl3 libtss2-esys; do
  grep -q "$library" <<<"$depends" || { echo "package test: Depends lacks $library" >&2; exit 1; }
done
dpkg -x "$deb" "$work/root"
version=$("$(find "$work/root" -path '*/bin/keymgr')" -v)
[ "$version" = "Version: 2.3" ] || { echo "package test: keymgr -v printed: $version" >&2; exit 1; }
echo "package checked"
