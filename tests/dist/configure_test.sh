#!/usr/bin/env bash
# configure_test.sh BUILD_DIR: the build options that would make a sealed or
# signed build weaker than it looks are refused when the build is configured,
# each with a message that names what is missing.
set -euo pipefail
here=$(cd "$(dirname "$0")" && pwd)
# shellcheck source=tests/dist/common.sh
. "$here/common.sh" configure-test "$1"
source=$(cd "$here/../.." && pwd)
digest=-DKEYMGR_DIGEST_PUBKEY=$source/tests/cli/data/digest_key.pub.pem
vendor=-DKEYMGR_POLICY_PUBKEY=$source/tests/policy/data/vendor_key.pub.pem
sealed=(-DKEYMGR_SEAL_TO_VERDICT=ON "$digest" "$vendor")
only_14_15="needs the verdict in PCR 14 or 15"

# refused NAME MESSAGE OPTION...: configuring with OPTION... fails and says
# MESSAGE.
rows=0
refused() {
  local name=$1 message=$2 dir=$work/$((rows += 1))
  shift 2
  if cmake -S "$source" -B "$dir" -DBUILD_TESTING=OFF "$@" >"$dir.out" 2>&1; then
    fail "$name: configured"
  fi
  grep -q "$message" "$dir.out" || fail "$name: no \"$message\" in $(cat "$dir.out")"
}
refused "a PCR anyone can reset" "$only_14_15" "${sealed[@]}" -DKEYMGR_MEASURE_PCR=16
refused "the last resettable PCR" "$only_14_15" "${sealed[@]}" -DKEYMGR_MEASURE_PCR=23
refused "the PCR the firmware measures the boot image into" "$only_14_15" \
  "${sealed[@]}" -DKEYMGR_MEASURE_PCR=4
refused "the PCR the EFI stub measures the command line into" "$only_14_15" \
  "${sealed[@]}" -DKEYMGR_MEASURE_PCR=12
refused "sealed without the vendor's key" "KEYMGR_POLICY_PUBKEY" \
  -DKEYMGR_SEAL_TO_VERDICT=ON "$digest" -DKEYMGR_MEASURE_PCR=14
refused "sealed without a signed digest file" "KEYMGR_DIGEST_PUBKEY" \
  -DKEYMGR_SEAL_TO_VERDICT=ON "$vendor" -DKEYMGR_MEASURE_PCR=14
refused "signed without a measured verdict" "needs KEYMGR_MEASURE_PCR" "$digest"
