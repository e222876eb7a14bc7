#!/bin/sh
# shellcheck shell=dash
# The chain's first boot. The host laid out release 1: the signed digest
# file and the vendor's signed policy for the image that boots. Before the
# hand-over the measured integration ran keymgr over them (no EEPROM image
# yet: a signed build verifies all the same, and its good verdict moved the
# release counter to 1), then the boot's first key proof, which found no
# key and closed PCR 14 with the separator. Then, as the root's programs:
# the EEPROM image with the gate and SFE_003, and the key (kmm-host 3),
# which pins the TPM's storage key in the EEPROM. The key opens only with
# PCR 14 at one good verdict: not after this boot's separator, from the
# next boot on.
# shellcheck source=scripts/vm/lib.sh
. /usr/lib/vmtest/lib.sh

log_is BN=OK
events_are BN=OK
run "keymgr-eeprom init" 0 keymgr-eeprom init
run "keymgr-eeprom write control byte" 0 keymgr-eeprom write control 42
run "keymgr-eeprom write SFE word" 0 keymgr-eeprom write sfe-conf 04000000
blank=$(keymgr-eeprom read storage-key-pin)
check "the storage key pin is blank" [ -z "$(echo "$blank" | tr -d 'F ')" ]
keys_are "before the regeneration" none
run "regeneration (kmm-host 3)" 0 kmm-host 3
pin=$(keymgr-eeprom read storage-key-pin)
check "the regeneration pinned the TPM's storage key ($(echo "$pin" | cut -c1-11) ...)" \
  [ -n "$(echo "$pin" | tr -d 'F ')" ]
keys_are "after the regeneration" named
# The later boots of the chain prove this key: no release makes it again.
named_key >"$state/chain-key"
run "boot proof (kmm-host 1 1) after the separator" 1 kmm-host 1 1
log_is BN=OK DT=FAIL
