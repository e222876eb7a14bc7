#!/bin/sh
# Buildroot: makes and signs the digest file of the target tree, so that a
# device with a signed keymgr build checks it at boot. Run it as a
# post-fakeroot script, the last step before Buildroot packs the root file
# system:
#   BR2_ROOTFS_POST_FAKEROOT_SCRIPT="... path/to/keymgr-digest.sh"
# Buildroot calls it inside fakeroot with the target folder, after its users
# and device tables have rewritten /etc/passwd, /etc/group and /etc/shadow
# and set owners and modes; a post-build script runs before those, so a
# manifest that lists them would fail every boot, and a post-image script
# runs on an image already packed. List it last among the post-fakeroot
# scripts: whatever changes a listed file after it fails the boot.
# It reads the target's /quorvan/hidden/keymgr.list and writes keymgr.cb and
# keymgr.sig beside it.
#   KEYMGR_DIGEST_KEY      the Ed25519 private key (PEM) that signs (required)
#   KEYMGR_RELEASE_COUNTER the release counter, from 1 (required)
#   KEYMGR_MKDIGEST        the host tool (default: $HOST_DIR/bin/keymgr-mkdigest,
#                          or keymgr-mkdigest on the PATH)
set -eu
target=${1:?usage: keymgr-digest.sh TARGET_DIR}
: "${KEYMGR_DIGEST_KEY:?KEYMGR_DIGEST_KEY must name the Ed25519 private key that signs}"
: "${KEYMGR_RELEASE_COUNTER:?KEYMGR_RELEASE_COUNTER must give the release counter, from 1}"
tool=${KEYMGR_MKDIGEST:-}
if [ -z "$tool" ]; then
  tool=keymgr-mkdigest
  if [ -n "${HOST_DIR:-}" ] && [ -x "$HOST_DIR/bin/keymgr-mkdigest" ]; then
    tool=$HOST_DIR/bin/keymgr-mkdigest
  fi
fi
exec "$tool" --root "$target" --key "$KEYMGR_DIGEST_KEY" --counter "$KEYMGR_RELEASE_COUNTER"
