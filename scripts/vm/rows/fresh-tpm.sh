#!/bin/sh
# shellcheck shell=dash
# A new TPM under the same disk: the key is not there.
# shellcheck source=scripts/vm/lib.sh
. /usr/lib/vmtest/lib.sh

run_boot_script
boot_status_is 1
log_is BN=OK DT=FAIL
keys_are "a fresh TPM" none
