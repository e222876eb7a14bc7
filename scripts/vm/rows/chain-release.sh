#!/bin/sh
# shellcheck shell=dash
# Release 2: a new initramfs (one file more) in a new image, its policy
# signed for that image and its keymgr.sig for release 2, put on the disk by
# the host as an update would put them; the key is not made again. The boot
# proves, and keymgr's good verdict moved the release counter to 2: release
# 1's keymgr.sig, which the host kept in /vmtest, is refused now.
# shellcheck source=scripts/vm/lib.sh
. /usr/lib/vmtest/lib.sh

check "the image is release 2's" grep -qx "release 2" /etc/vmtest-release
log_is BN=OK DT=OK
events_are BN=OK
check "the event log names release 2" grep -q '"release":2}' "$events"
check "PCR 4 holds what keymgr-mkpolicy predicted from release 2's image" \
  [ "$(pcr 4)" = "$policy_pcr4" ]
check "the key is the one made at provisioning" [ "$(named_key)" = "$(cat "$state/chain-key")" ]
cp "$hidden/keymgr.sig" /tmp/keymgr.sig
cp "$state/release-1.sig" "$hidden/keymgr.sig"
run "keymgr over release 1's keymgr.sig" 1 keymgr
check "the release counter is at 2: release 1 is refused" \
  grep -qx "release counter: 1 is below the release that booted, 2!!!" /tmp/run.out
cp /tmp/keymgr.sig "$hidden/keymgr.sig"
