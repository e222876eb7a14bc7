#!/bin/sh
# shellcheck shell=dash
# The boot after the panic: all is as before it.
# shellcheck source=scripts/vm/lib.sh
. /usr/lib/vmtest/lib.sh

run_boot_script
boot_status_is 0
log_is BN=OK DT=OK
keys_are "after the panic" named
