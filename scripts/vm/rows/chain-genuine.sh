#!/bin/sh
# shellcheck shell=dash
# A boot of the genuine chain: U-Boot measured the image it started, and the
# kernel the stub started from it, into PCR 4; no load options reached the
# stub (PCR 12); keymgr's good verdict went into PCR 14 and the boot's first
# key proof opened the key before the hand-over, then closed PCR 14 with the
# separator. A second proof, by a root file system's program, finds it
# closed.
# shellcheck source=scripts/vm/lib.sh
. /usr/lib/vmtest/lib.sh

log_is BN=OK DT=OK
events_are BN=OK
for n in 0 4 12 14; do echo "vmtest: PCR $n = $(pcr $n)"; done
check "PCR 4 holds what keymgr-mkpolicy predicted from the image" [ "$(pcr 4)" = "$policy_pcr4" ]
check "PCR 12 holds what keymgr-mkpolicy bound (no load options)" [ "$(pcr 12)" = "$policy_pcr12" ]
check "the key is the one made at provisioning" [ "$(named_key)" = "$(cat "$state/chain-key")" ]
run "a second boot proof (kmm-host 1 1)" 1 kmm-host 1 1
log_is BN=OK DT=OK DT=FAIL
