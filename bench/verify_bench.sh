#!/usr/bin/env bash
# The boot verification against openssl dgst -sha256 and sha256sum on the
# same files: median wall times (paired runs, warm cache), their ratio and
# keymgr's peak resident memory, for 8 files of 64 MiB, 5,000 files of
# 4 KiB and one file of 1.5 GiB; then a boot run with the gate closed.
#   bench/verify_bench.sh [RUNS] [BASE]     (defaults: 7, none)
# It makes a release build in build-bench/ for the sandbox root
# $KEYMGR_BENCH_ROOT (default /tmp/keymgr-bench), where it keeps the files
# (about 2 GiB) from one run to the next. BASE, a git revision, is built as
# well and timed in the same runs, for a before and after table.
set -euo pipefail
cd "$(dirname "$0")/.."
. bench/lib.sh
runs=${1:-7}
base=${2:-}
root=${KEYMGR_BENCH_ROOT:-/tmp/keymgr-bench}
out=build-bench
bash scripts/install-deps.sh

# build SOURCE DIR: a release build of keymgr and keymgr-eeprom for the root.
build() {
  cmake -S "$1" -B "$2" -G Ninja -DCMAKE_BUILD_TYPE=Release -DBUILD_TESTING=OFF \
    -DKEYMGR_ROOT="$root" >/dev/null
  cmake --build "$2" --target keymgr keymgr-eeprom >/dev/null
}
build . "$out/this"
labels=(keymgr)
programs=("$out/this/cli/keymgr")
if [ -n "$base" ]; then
  rm -rf "$out/base-src"
  mkdir -p "$out/base-src"
  git archive "$base" | tar -x -C "$out/base-src"
  build "$out/base-src" "$out/base"
  labels+=("keymgr $base")
  programs+=("$out/base/cli/keymgr")
fi
eeprom=$out/this/tools/keymgr-eeprom

# The file sets, made once: random bytes, so nothing compresses or dedups.
data=$root/bench-data
mkdir -p "$root/quorvan/hidden" "$root/quorvan/spool/log" "$data"
if [ ! -f "$data/done" ]; then
  echo "making the files in $data ..." >&2
  rm -rf "${data:?}"/*
  mkdir -p "$data/large" "$data/small"
  for i in $(seq 8); do
    head -c 64M /dev/urandom >"$data/large/$i"
  done
  head -c $((5000 * 4096)) /dev/urandom | split -b 4096 -a 4 -d - "$data/small/"
  head -c 1536M /dev/urandom >"$data/huge"
  touch "$data/done"
fi
sets=("8 x 64 MiB" "5000 x 4 KiB" "1 x 1.5 GiB")
globs=("$data/large/*" "$data/small/*" "$data/huge")

# Control byte 0x42 opens the gate; SFE_003 stays off, so the run is quiet.
"$eeprom" init
"$eeprom" write 4958 00000000
"$eeprom" write 5049 42

printf '%-14s %-22s %10s %12s %6s %10s %11s  %s\n' "file set" "build" "keymgr" \
  "openssl dgst" "ratio" "sha256sum" "keymgr peak" "log"
for s in "${!sets[@]}"; do
  # shellcheck disable=SC2206
  files=(${globs[$s]})
  printf '%s\n' "${files[@]}" >"$root/quorvan/hidden/keymgr.list"
  "${programs[0]}" hash
  declare -A times=()
  # Paired: every program once per round, so that drift hits all alike.
  for _ in $(seq "$runs"); do
    for p in "${!programs[@]}"; do
      times[$p]+="$(wall_ms "${programs[$p]}") "
    done
    times[openssl]+="$(wall_ms openssl dgst -sha256 "${files[@]}") "
    times[sha256sum]+="$(wall_ms sha256sum "${files[@]}") "
  done
  ossl=$(median_of "${times[openssl]}")
  sums=$(median_of "${times[sha256sum]}")
  for p in "${!programs[@]}"; do
    mine=$(median_of "${times[$p]}")
    peak=$(peak_mib "${programs[$p]}")
    outcome=$(cat "$root/quorvan/spool/log/keymgr.log")
    awk -v set="${sets[$s]}" -v label="${labels[$p]}" -v mine="$mine" -v ossl="$ossl" \
      -v sums="$sums" -v peak="$peak" -v outcome="$outcome" 'BEGIN {
        printf "%-14s %-22s %8.3f s %10.3f s %6.2f %8.3f s %7.1f MiB  %s\n", set, label,
          mine / 1000, ossl / 1000, mine / ossl, sums / 1000, peak, outcome }'
  done
  unset times
done

# Gate closed: the control byte does not enable it, SFE_003 is off. Starting
# any program from the shell costs something; /bin/true shows how much.
"$eeprom" write 5049 00
declare -A closed=()
for _ in $(seq $((3 * runs))); do
  for p in "${!programs[@]}"; do
    closed[$p]+="$(wall_ms "${programs[$p]}") "
  done
  closed[floor]+="$(wall_ms /bin/true) "
done
for p in "${!programs[@]}"; do
  printf '%-37s %8.3f ms\n' "gate closed, ${labels[$p]}" "$(median_of "${closed[$p]}")"
done
printf '%-37s %8.3f ms\n' "/bin/true, for scale" "$(median_of "${closed[floor]}")"
echo "medians of $runs paired runs ($((3 * runs)) with the gate closed), warm cache"
