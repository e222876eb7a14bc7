#!/usr/bin/env bash
# What the TPM sees of a regeneration (kmm-host 3, with a previous key to
# replace) and of a boot proof (kmm-host 1 1): commands and asymmetric
# operations, counted on the TPM socket by bench/tpm_proxy, and the median
# wall time of each on a fresh swtpm; again with a persistent SRK when the
# build's kmm-host can make one.
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
  echo "$1 kmm-host 1 1: $(cost "$host" 1 1); median $(median_ms "$runs" "$host" 1 1) ms over $runs runs"
}

report "no SRK:  "
if "$host" srk 2>/dev/null; then
  report "with SRK:"
fi
