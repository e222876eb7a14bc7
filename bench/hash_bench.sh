#!/usr/bin/env bash
# Median wall time of keymgr hash over a manifest of small files in the
# build's sandbox root (the file system under it decides what a sync costs).
#   bench/hash_bench.sh [BUILD_DIR] [N] [FILES]     (defaults: build, 7, 5000)
set -euo pipefail
cd "$(dirname "$0")/.."
. bench/lib.sh
build=${1:-build}
runs=${2:-7}
files=${3:-5000}
[ -f "$build/CMakeCache.txt" ] || { echo "no $build/CMakeCache.txt: configure and build first" >&2; exit 1; }
root=$(build_setting "$build" KEYMGR_ROOT)
keymgr=$build/cli/keymgr
[ -n "$root" ] || { echo "the build has no KEYMGR_ROOT sandbox" >&2; exit 1; }
[ -x "$keymgr" ] || { echo "build keymgr first" >&2; exit 1; }

mkdir -p "$root/quorvan/hidden" "$root/bench-files"
manifest=$root/quorvan/hidden/keymgr.list
: >"$manifest"
for i in $(seq "$files"); do
  f=$root/bench-files/$i
  [ -f "$f" ] || head -c 4096 /dev/urandom >"$f"
  echo "$f" >>"$manifest"
done
"$keymgr" hash   # warm the cache

echo "keymgr hash ($files files of 4 KiB): median $(median_ms "$runs" "$keymgr" hash) ms over $runs runs"
