#!/usr/bin/env bash
# Median wall time of a regeneration (kmm-host 3) and of a boot proof
# (kmm-host 1 1) on the build's sandbox root and a fresh swtpm.
#   bench/kmm_bench.sh [BUILD_DIR] [N]     (defaults: build, 7)
# Do not run it while that build's test suite runs: both use the same swtpm
# socket and sandbox root.
set -euo pipefail
cd "$(dirname "$0")/.."
. bench/lib.sh
build=${1:-build}
runs=${2:-7}
[ -f "$build/CMakeCache.txt" ] || { echo "no $build/CMakeCache.txt: configure and build first" >&2; exit 1; }
root=$(build_setting "$build" KEYMGR_ROOT)
tcti=$(build_setting "$build" KEYMGR_TCTI)
host=$build/tools/kmm-host
eeprom=$build/tools/keymgr-eeprom
[ -n "$root" ] || { echo "the build has no KEYMGR_ROOT sandbox" >&2; exit 1; }
if [ ! -x "$host" ] || [ ! -x "$eeprom" ]; then
  echo "build kmm-host and keymgr-eeprom first" >&2
  exit 1
fi

mkdir -p "$root/run" "$root/quorvan/hidden" "$root/quorvan/spool/log"
scripts/swtpm-fixture.sh start "$tcti" >/dev/null
trap 'scripts/swtpm-fixture.sh stop "$tcti" >/dev/null' EXIT
"$eeprom" init
"$eeprom" write 4958 04000000   # SFE_003 on, so the boot proof logs its line

regen=$(median_ms "$runs" "$host" 3)
boot=$(median_ms "$runs" "$host" 1 1)
echo "kmm-host 3   (regenerate): median ${regen} ms over $runs runs"
echo "kmm-host 1 1 (normal boot): median ${boot} ms over $runs runs"
