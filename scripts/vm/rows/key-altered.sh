#!/bin/sh
# shellcheck shell=dash
# A key file altered: a byte of keymgr.hddpwd inverted, the key check fails.
# shellcheck source=scripts/vm/lib.sh
. /usr/lib/vmtest/lib.sh

# flip_byte FILE: inverts the first byte of FILE in place.
flip_byte() {
  local byte
  byte=$(od -An -tu1 -N1 "$1" | tr -d ' ')
  printf '%b' "\\0$(printf %03o $((byte ^ 255)))" | dd of="$1" bs=1 count=1 conv=notrunc 2>/dev/null
}

cp "$hidden/keymgr.hddpwd" /tmp/keymgr.hddpwd
flip_byte "$hidden/keymgr.hddpwd"
run_boot_script
boot_status_is 1
log_is BN=OK DT=FAIL
cp /tmp/keymgr.hddpwd "$hidden/keymgr.hddpwd"
