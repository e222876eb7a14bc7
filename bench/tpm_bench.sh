#!/usr/bin/env bash
# What the TPM sees of a regeneration (kmm-host 3, with a previous key to
# replace) and of a boot proof (kmm-host 1 1): commands and asymmetric
# operations, counted on the TPM socket by bench/tpm_proxy, and the median
# wall time of each on a fresh swtpm; again with a persistent SRK when the
# build's kmm-host can make one. A build with KEYMGR_MEASURE_PCR (and
# KEYMGR_SEAL_TO_VERDICT) is measured as a device boots it: each boot proof
# follows a power cycle, the firmware's measurement of a boot image into
# PCR 4, and keymgr's boot run, whose own commands are counted too; a signed
# build's boot run is counted again when it moves the release counter. A signed
# or sealed build must be configured with the test keys
# (tests/cli/data/digest_key.pub.pem, tests/policy/data/vendor_key.pub.pem):
# the bench signs its release with their private halves.
#   bench/tpm_bench.sh BUILD_DIR [N]        (N defaults to 9)
# BUILD_DIR must be configured with -DKEYMGR_TCTI=swtpm:path=ROOT/run/proxy.sock
# (ROOT its KEYMGR_ROOT); the proxy comes from $TPM_PROXY, by default
# build/bench/tpm_proxy of this tree.
set -euo pipefail
cd "$(dirname "$0")/.."
. bench/lib.sh
build=${1:?usage: bench/tpm_bench.sh BUILD_DIR [N]}
runs=${2:-9}
proxy=${TPM_PROXY:-build/bench/tpm_proxy}
root=$(build_setting "$build" KEYMGR_ROOT)
tcti=$(build_setting "$build" KEYMGR_TCTI)
listen=${tcti#swtpm:path=}
[ "$listen" != "$tcti" ] || { echo "$build: KEYMGR_TCTI must be swtpm:path=SOCKET" >&2; exit 1; }
[ -x "$proxy" ] || { echo "no $proxy: build this tree with tests first" >&2; exit 1; }
host=$build/tools/kmm-host
eeprom=$build/tools/keymgr-eeprom

upstream="swtpm:path=$root/tpm/swtpm.sock"
log=$root/tpm/commands
mkdir -p "$root/tpm" "$root/quorvan/hidden" "$root/quorvan/spool/log" "$(dirname "$listen")"
scripts/swtpm-fixture.sh start "$upstream" >/dev/null
"$proxy" "$listen" "$root/tpm/swtpm.sock" "$log" &
proxy_pid=$!
# tpm2-tss's own swtpm transport also talks to the control channel beside it.
ln -sf "$root/tpm/swtpm.sock.ctrl" "$listen.ctrl"
trap 'kill $proxy_pid 2>/dev/null; scripts/swtpm-fixture.sh stop "$upstream" >/dev/null' EXIT
for _ in $(seq 50); do [ -S "$listen" ] && break; sleep 0.1; done
"$eeprom" init
"$eeprom" write 4958 04000000   # SFE_003 on, so the boot proof logs its line
# One listed file, its digest file made as the build takes it: signed on the
# host for a signed build, with the vendor's policy for a sealed one.
hidden=$root/quorvan/hidden
echo bench >"$root/quorvan/listed"
echo "$root/quorvan/listed" >"$hidden/keymgr.list"
# PCR 4 once the firmware measured the boot image "image".
image_pcr=$( (head -c 32 /dev/zero; printf image | openssl dgst -sha256 -binary) |
  openssl dgst -sha256 -r | cut -d' ' -f1)
signed=$(build_setting "$build" KEYMGR_DIGEST_PUBKEY)
# sign_release N: the digest file of release N, and its policy in a sealed
# build.
sign_release() {
  "$build/tools/keymgr-mkdigest" --root / --manifest "$hidden/keymgr.list" \
    --output "$hidden/keymgr.cb" --key tests/cli/data/digest_key.pem --counter "$1"
  if [ "$(build_setting "$build" KEYMGR_SEAL_TO_VERDICT)" = ON ]; then
    "$build/tools/keymgr-mkpolicy" --key tests/policy/data/vendor_key.pem --release "$1" \
      --verdict-pcr "$(build_setting "$build" KEYMGR_MEASURE_PCR)" --pcr "4=$image_pcr" \
      --output "$hidden/keymgr.policy" >/dev/null
  fi
}
if [ -n "$signed" ]; then
  sign_release 1
else
  "$build/cli/keymgr" hash
fi

# before_boot readies a boot proof of a measured build, whose key may need
# the verdict in its PCR: a power cycle (PCRs reset), the firmware's
# measurement, then keymgr's boot run. None is counted or timed.
measured=$(build_setting "$build" KEYMGR_MEASURE_PCR)
power_on() {
  swtpm_ioctl --unix "$root/tpm/swtpm.sock.ctrl" -i
  tpm2_startup -c -T "$upstream"
  tpm2_pcrextend -T "$upstream" "4:sha256=$(printf image | sha256sum | cut -d' ' -f1)"
}
before_boot() {
  [ -n "$measured" ] || return 0
  power_on
  "$build/cli/keymgr" >/dev/null
}

# boot_ms prints the median wall time of RUNS boot proofs, each readied.
boot_ms() {
  for _ in $(seq "$runs"); do
    before_boot
    wall_ms "$host" 1 1
  done | median
}

# keymgr_ms prints the median wall time of RUNS boot runs, each after a
# power cycle and the firmware's measurement.
keymgr_ms() {
  for _ in $(seq "$runs"); do
    power_on
    wall_ms "$build/cli/keymgr"
  done | median
}

# cost CMD...: runs CMD once and prints its TPM commands and, of those, the
# asymmetric operations: key generation, a salted session, RSA.
cost() {
  : >"$log"
  "$@" >/dev/null || { echo "failed: $*" >&2; exit 1; }
  awk '{ n++; c = $1
         if (c == "131" || c == "153" || c == "191" || c == "159" || c == "174" ||
             (c == "176" && $2 != "40000007")) a++ }
       END { printf "%d commands, %d asymmetric", n, a }' "$log"
}

report() {
  "$host" 3 >/dev/null   # a previous key for the measured regeneration to replace
  echo "$1 kmm-host 3:   $(cost "$host" 3); median $(median_ms "$runs" "$host" 3) ms over $runs runs"
  if [ -n "$measured" ]; then
    power_on
    echo "$1 keymgr:       $(cost "$build/cli/keymgr"); median $(keymgr_ms) ms over $runs runs"
  fi
  before_boot
  echo "$1 kmm-host 1 1: $(cost "$host" 1 1); median $(boot_ms) ms over $runs runs"
}

report "no SRK:  "
if "$host" srk 2>/dev/null; then
  report "with SRK:"
fi

# A signed build's boot run after an update to the next release, which moves
# the release counter up by one; each timed run boots a release of its own.
if [ -n "$signed" ]; then
  sign_release 2
  power_on
  echo "release +1 keymgr:    $(cost "$build/cli/keymgr")"
  moved=$(for release in $(seq 3 $((runs + 2))); do
    sign_release "$release"
    power_on
    wall_ms "$build/cli/keymgr"
  done | median)
  echo "release +1 keymgr:    median $moved ms over $runs runs"
fi
