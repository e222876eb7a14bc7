#!/bin/sh
# shellcheck shell=dash
# Provisioning: the boot script finds nothing to verify yet; then the EEPROM
# image, the manifest, its digest file, and the key material.
# shellcheck source=scripts/vm/lib.sh
. /usr/lib/vmtest/lib.sh

tcti=${vmtest_tcti:-}
check "kmm-host talks to the TPM through $tcti" \
  sh -c "strings /usr/bin/kmm-host | grep -qx '$tcti'"
run_boot_script
log_is ""
run "keymgr-eeprom init" 0 keymgr-eeprom init
# Later boots check that a cut leaves the image whole: as long as this.
wc -c </sys/bus/i2c/devices/0-0050/eeprom >"$state/eeprom-size"
# The integrity check's control byte (mode 2, enabled) and SFE_003, so that
# the key check logs its DT line.
run "keymgr-eeprom write control byte" 0 keymgr-eeprom write control 42
run "keymgr-eeprom write SFE word" 0 keymgr-eeprom write sfe-conf 04000000
cp "$state/manifest" "$hidden/keymgr.list"
run "keymgr hash" 0 keymgr hash
check "keymgr.cb holds a record per listed file" \
  [ "$(wc -c <"$hidden/keymgr.cb")" = $((32 * $(wc -w <"$hidden/keymgr.list"))) ]
keys_are "before the first regeneration" none
regenerate_and_boot
