#!/usr/bin/env bash
# Median wall time of a regeneration (kmm-host 3) and of a boot proof
# (kmm-host 1 1) on the build's sandbox root and a fresh swtpm.
#   bench/kmm_bench.sh [BUILD_DIR] [N]     (defaults: build, 7)
# Do not run it while that build's test suite runs: both use the same swtpm
# socket and sandbox root.
set -euo pipefail
cd "$(dirname "$0")/.."
build=${1:-build}
runs=${2:-7}
cache=$build/CMakeCache.txt
[ -f "$cache" ] || { echo "no $cache: configure and build first" >&2; exit 1; }
setting() { sed -n "s/^$1:[A-Z]*=//p" "$cache"; }
root=$(setting KEYMGR_ROOT)
tcti=$(setting KEYMGR_TCTI)
host=$build/tools/kmm-host
eeprom=$build/tools/keymgr-eeprom
[ -n "$root" ] || { echo "the build has no KEYMGR_ROOT sandbox" >&2; exit 1; }
[ -x "$host" ] && [ -x "$eeprom" ] || { echo "build kmm-host and keymgr-eeprom first" >&2; exit 1; }

mkdir -p "$root/run" "$root/quorvan/hidden" "$root/quorvan/spool/log"
scripts/swtpm-fixture.sh start "$tcti" >/dev/null
trap 'scripts/swtpm-fixture.sh stop "$tcti" >/dev/null' EXIT
"$eeprom" init
"$eeprom" write 4958 04000000   # SFE_003 on, so the boot proof logs its line

# median_ms CMD...: runs CMD $runs times (it must succeed) and prints the
# median wall time in milliseconds.
median_ms() {
  local times=() start end
  for _ in $(seq "$runs"); do
    start=$(date +%s%N)
    "$@" >/dev/null || { echo "failed: $*" >&2; exit 1; }
    end=$(date +%s%N)
    times+=($(( (end - start) / 1000 )))
  done
  printf '%s\n' "${times[@]}" | sort -n |
    awk '{ t[NR] = $1 } END { printf "%.1f\n", t[int((NR + 1) / 2)] / 1000 }'
}

regen=$(median_ms "$host" 3)
boot=$(median_ms "$host" 1 1)
echo "kmm-host 3   (regenerate): median ${regen} ms over $runs runs"
echo "kmm-host 1 1 (normal boot): median ${boot} ms over $runs runs"
