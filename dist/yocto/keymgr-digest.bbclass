# keymgr-digest.bbclass: makes and signs the digest file of an image's root
# file system, so that a device with a signed keymgr build checks it at boot.
# In an image recipe:
#   inherit keymgr-digest
#   KEYMGR_DIGEST_KEY = "/path/to/digest-key.pem"   (Ed25519 private key, PEM)
#   KEYMGR_RELEASE_COUNTER = "42"                   (from 1)
# The image's /quorvan/hidden/keymgr.list names the protected files;
# keymgr.cb and keymgr.sig are written beside it. It runs as an image
# preprocess command (IMAGE_PREPROCESS_COMMAND), in do_image: after every
# rootfs post-processing step (ROOTFS_POSTPROCESS_COMMAND: extra users,
# /etc/timestamp and the like, which may change listed files), before the
# image types are made. Inherit it last: whatever changes a listed file
# after it fails the boot. keymgr-mkdigest comes from keymgr-native.

KEYMGR_DIGEST_KEY ??= ""
KEYMGR_RELEASE_COUNTER ??= ""
KEYMGR_MKDIGEST ??= "keymgr-mkdigest"

DEPENDS:append = " keymgr-native"
IMAGE_PREPROCESS_COMMAND:append = " keymgr_digest_rootfs;"

keymgr_digest_rootfs() {
	if [ -z "${KEYMGR_DIGEST_KEY}" ]; then
		bbfatal "keymgr-digest: set KEYMGR_DIGEST_KEY to the Ed25519 private key that signs"
	fi
	if [ -z "${KEYMGR_RELEASE_COUNTER}" ]; then
		bbfatal "keymgr-digest: set KEYMGR_RELEASE_COUNTER to the release counter, from 1"
	fi
	${KEYMGR_MKDIGEST} --root ${IMAGE_ROOTFS} --key ${KEYMGR_DIGEST_KEY} \
		--counter ${KEYMGR_RELEASE_COUNTER}
}
