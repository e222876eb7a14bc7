#!/bin/sh
# shellcheck shell=dash
# A normal boot: both checks pass.
# shellcheck source=scripts/vm/lib.sh
. /usr/lib/vmtest/lib.sh

run_boot_script
boot_status_is 0
log_is BN=OK DT=OK
