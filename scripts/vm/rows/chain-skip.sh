#!/bin/sh
# shellcheck shell=dash
# An image of the attacker's, started by the same firmware: its initramfs
# (scripts/vm/skip-keymgr.sh in place of the measured integration) skipped
# keymgr, extended PCR 14 with the good verdict by hand and ran the key
# proof. PCR 14 held the good value, but PCR 4 holds the attacker's image,
# which the vendor's policy does not name: the key stays closed.
# shellcheck source=scripts/vm/lib.sh
. /usr/lib/vmtest/lib.sh

added=$(tail -n +$(($(wc -l </tmp/log.before) + 1)) "$log" | paste -sd' ')
check "the proof logged ${added:-nothing}, expected DT=FAIL and no DT=OK" [ "$added" = DT=FAIL ]
check "PCR 4 is not the value the policy binds" [ "$(pcr 4)" != "$policy_pcr4" ]
keys_are "after the attack" named
