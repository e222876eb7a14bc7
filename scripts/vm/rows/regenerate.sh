#!/bin/sh
# shellcheck shell=dash
# A regeneration over this system's key: the old key goes, one new one is
# there.
# shellcheck source=scripts/vm/lib.sh
. /usr/lib/vmtest/lib.sh

run_boot_script
boot_status_is 0
log_is BN=OK DT=OK
keys_are "before" named
old_key=$(named_key)
regenerate_and_boot
new_key=$(named_key)
replaced() { [ -n "$old_key" ] && [ -n "$new_key" ] && [ "$new_key" != "$old_key" ]; }
check "the new key replaced the old one" replaced
log_is BN=OK DT=OK DT=OK
