#!/bin/sh
# shellcheck shell=dash
# A listed file altered: the boot verification fails; the key check too
# when the key is sealed to the verdict.
# shellcheck source=scripts/vm/lib.sh
. /usr/lib/vmtest/lib.sh

cp /quorvan/protected/device.conf /tmp/device.conf
echo "altered" >>/quorvan/protected/device.conf
run_boot_script
if [ -n "$sealed" ]; then
  # The key needs the good verdict.
  boot_status_is 1
  log_is BN=FAIL DT=FAIL
  check "the event log holds the verdict BN=FAIL" grep -q '"verdict":"BN=FAIL"' "$events"
else
  boot_status_is 0
  log_is BN=FAIL DT=OK
fi
cp /tmp/device.conf /quorvan/protected/device.conf
