#!/usr/bin/env bash
# hook_test.sh BUILD_DIR [EMULATOR...]: the Buildroot hook run as Buildroot's
# fakeroot script runs it, once the users table has rewritten /etc/passwd:
# keymgr.cb and keymgr.sig must cover /etc/passwd as it is packed.
set -euo pipefail
here=$(cd "$(dirname "$0")" && pwd)
# shellcheck source=tests/dist/common.sh
. "$here/common.sh" hook-test "$@"
source=$(cd "$here/../.." && pwd)
target=$work/target
hidden=$target/quorvan/hidden
mkdir -p "$target/etc" "$hidden"
echo 'root:x:0:0:root:/root:/bin/sh' >"$target/etc/passwd"
echo /etc/passwd >"$hidden/keymgr.list"
# The host tool, under the emulator in a cross build.
tool=$work/keymgr-mkdigest
printf '#!/bin/sh\nexec %s "$@"\n' "$(printf '%q ' "${emulator[@]}" "$build/tools/keymgr-mkdigest")" \
  >"$tool"
chmod +x "$tool"
# Buildroot's fakeroot script (fs/common.mk): owners, the users table
# (mkusers adds its users to /etc/passwd), then the post-fakeroot scripts.
cat >"$work/fakeroot.sh" <<SCRIPT
set -e
[ "\$(id -u)" -ne 0 ] || chown -h -R 0:0 '$target'
echo 'kmuser:x:1000:1000::/home/kmuser:/bin/sh' >>'$target/etc/passwd'
KEYMGR_MKDIGEST='$tool' KEYMGR_DIGEST_KEY='$source/tests/cli/data/digest_key.pem' \\
  KEYMGR_RELEASE_COUNTER=3 '$source/dist/buildroot/keymgr-digest.sh' '$target'
SCRIPT
run=(sh)
if command -v fakeroot >/dev/null; then
  run=(fakeroot -- sh)
fi
"${run[@]}" "$work/fakeroot.sh" || fail "the hook failed"
grep -q '^kmuser:' "$target/etc/passwd" || fail "the users table did not run"

# keymgr.cb is the digest of /etc/passwd as packed; keymgr.sig binds the
# manifest, keymgr.cb and release 3 with the test key.
sha() { openssl dgst -sha256 -binary "$@"; }
sha "$target/etc/passwd" | cmp -s - "$hidden/keymgr.cb" || fail "keymgr.cb misses /etc/passwd"
sig=$hidden/keymgr.sig
[ "$(od -An -tx1 -j16 -N8 "$sig" | tr -d ' \n')" = 0000000000000003 ] || fail "not release 3"
tail -c +25 "$sig" | head -c 32 | cmp -s - <(sha "$hidden/keymgr.list") || fail "the manifest"
tail -c +57 "$sig" | head -c 32 | cmp -s - <(sha "$hidden/keymgr.cb") || fail "keymgr.cb"
head -c 88 "$sig" >"$work/signed"
tail -c 64 "$sig" >"$work/signature"
openssl pkeyutl -verify -pubin -inkey "$source/tests/cli/data/digest_key.pub.pem" -rawin \
  -in "$work/signed" -sigfile "$work/signature" >/dev/null || fail "the signature"
