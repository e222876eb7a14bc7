#!/usr/bin/env bash
# Makes a device build and its Debian package:
#   scripts/package.sh [--target aarch64|armhf] [CMAKE_ARG...]
# in build-package/ (this machine's architecture) or build-package-TARGET/.
# The build is MinSizeRel, without tests, for the device's own paths (no
# KEYMGR_ROOT), installed to /usr with the init script in /etc/init.d.
# CMAKE_ARGs add build options, such as -DKEYMGR_DMSETUP_SHA256=DIGEST.
# It leaves the stripped install tree in BUILD/install and the package in
# BUILD/, and prints the programs' sizes and the package's name.
set -euo pipefail
cd "$(dirname "$0")/.."

usage() {
  echo "usage: $0 [--target aarch64|armhf] [CMAKE_ARG...]" >&2
  exit 2
}

build="build-package"
extra=()
if [ "${1:-}" = --target ]; then
  build=build-package-${2:-}
  # shellcheck source=scripts/cross-setup.sh
  . scripts/cross-setup.sh "${2:-}" "$build"
  extra=("${cross_args[@]}")
  shift 2
else
  echo "== installing what packaging needs =="
  bash scripts/install-deps.sh package
fi
for arg; do [[ $arg == -D* ]] || usage; done

echo "== building the device build in $build/ =="
cmake -S . -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=MinSizeRel -DBUILD_TESTING=OFF -DKEYMGR_ROOT= \
  -DKEYMGR_REDACT_OOK=ON \
  -DCMAKE_INSTALL_PREFIX=/usr -DKEYMGR_INITDIR=/etc/init.d "${extra[@]}" "$@" >/dev/null
cmake --build "$build" -j "$(nproc)"
echo "== installing into $build/install and making the package =="
rm -rf "$build/install" "$build"/keymgr_*.deb
DESTDIR=$PWD/$build/install cmake --install "$build" --strip >/dev/null
(cd "$build" && cpack -G DEB >/dev/null)

# The device build keeps tpm2-tss's log off whatever TSS2_LOG says: its trace
# shows session keys and auth values. Checked only where no TPM device is
# there to be sent anything.
if [ ! -e /dev/tpm0 ] && [ ! -e /dev/tpmrm0 ]; then
  run=()
  [ -z "${cpu:-}" ] || run=("qemu-$cpu-static" -L "$build/sysroot")
  tss_log=$(TSS2_LOG=all+trace LD_LIBRARY_PATH="$PWD/$build/install/usr/lib" \
    "${run[@]}" "$build/install/usr/bin/kmm-host" srk 2>&1 >/dev/null || true)
  if [ -n "$tss_log" ]; then
    printf 'the device build lets tpm2-tss log:\n%s\n' "$tss_log" >&2
    exit 1
  fi
fi

echo "Stripped programs in $build/install/usr/bin:"
for program in keymgr kmm-host keymgr-eeprom; do
  printf '  %-14s %7d bytes\n' "$program" "$(stat -c %s "$build/install/usr/bin/$program")"
done
deb=$(ls "$build"/keymgr_*.deb)
echo "Package: $deb"
echo "  Architecture: $(dpkg-deb -f "$deb" Architecture)"
echo "  Depends: $(dpkg-deb -f "$deb" Depends)"
