#!/bin/sh
# Buildroot: makes and signs the digest file of the target tree, so that a
# device with a signed keymgr build checks it at boot. Run it as a
# post-build script, which Buildroot calls with the target folder before it
# packs the root file system (a post-image script would run too late, on an
# image already packed):
#   BR2_ROOTFS_POST_BUILD_SCRIPT="... path/to/keymgr-digest.sh"
# It reads the target's /quorvan/hidden/keymgr.list and writes keymgr.cb and
# keymgr.sig beside it.
#   KEYMGR_DIGEST_KEY      the Ed25519 private key (PEM) that signs (required)
#   KEYMGR_RELEASE_COUNTER the release counter (default 0)
#   KEYMGR_MKDIGEST        the host tool (default: $HOST_DIR/bin/keymgr-mkdigest,
#                          or keymgr-mkdigest on the PATH)
set -eu
target=${1:?usage: keymgr-digest.sh TARGET_DIR}
: "${KEYMGR_DIGEST_KEY:?KEYMGR_DIGEST_KEY must name the Ed25519 private key that signs}"
tool=${KEYMGR_MKDIGEST:-}
if [ -z "$tool" ]; then
  tool=keymgr-mkdigest
  if [ -n "${HOST_DIR:-}" ] && [ -x "$HOST_DIR/bin/keymgr-mkdigest" ]; then
    tool=$HOST_DIR/bin/keymgr-mkdigest
  fi
fi
exec "$tool" --root "$target" --key "$KEYMGR_DIGEST_KEY" --counter "${KEYMGR_RELEASE_COUNTER:-0}"
