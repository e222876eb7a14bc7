#!/bin/sh
# shellcheck shell=dash
# The attacker's initramfs of the chain-skip row holds this in place of the
# measured integration's scripts/local-bottom/keymgr: keymgr never runs. The
# good verdict's event goes into PCR 14 by hand, a raw TPM2_PCR_Extend
# written to the kernel's resource manager, then the key proof runs as the
# measured integration would run it.
# shellcheck source=scripts/vm/lib.sh
. /usr/lib/vmtest/lib.sh

good=$(printf 'keymgr boot verdict: BN=OK' | sha256sum | cut -c1-64)
# TPM2_PCR_Extend: a command with sessions of 65 bytes, its code, PCR 14,
# the password session (9 bytes: its handle, no nonce, no attributes, the
# empty password), one digest, SHA-256, the digest.
command="8002 00000041 00000182 0000000e 00000009 40000009 0000 00 0000 00000001 000b $good"
# shellcheck disable=SC2059 # the format is the command's bytes
printf "$(echo "$command" | tr -d ' ' | sed 's/../\\x&/g')" >/tmp/extend
exec 3<>/dev/tpmrm0
cat /tmp/extend >&3
response=$(dd bs=4096 count=1 <&3 2>/dev/null | hex_of -)
exec 3<&-
check "PCR 14 extended by hand with the good verdict's event (response $response)" \
  [ "$(echo "$response" | cut -c13-20)" = 00000000 ]
check "PCR 14 holds the value of one good verdict, the one the policy binds" \
  [ "$(pcr 14)" = "$policy_pcr14" ]
cp "$log" /tmp/log.before
kmm-host 1 1
