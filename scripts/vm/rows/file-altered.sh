#!/bin/sh
# shellcheck shell=dash
# A listed file altered: the boot verification fails, the key check does
# not.
# shellcheck source=scripts/vm/lib.sh
. /usr/lib/vmtest/lib.sh

cp /quorvan/protected/device.conf /tmp/device.conf
echo "altered" >>/quorvan/protected/device.conf
run_boot_script
boot_status_is 0
log_is BN=FAIL DT=OK
cp /tmp/device.conf /quorvan/protected/device.conf
