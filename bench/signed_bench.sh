#!/usr/bin/env bash
# A signed boot run against an unsigned one on the same files: median wall
# times of paired runs (warm cache), for a small set (50 files of 4 KiB, a
# manifest and digest file that the signature check reads whole) and a
# larger one (5,000 files of 4 KiB).
#   bench/signed_bench.sh [RUNS]     (default 21)
# It makes two release builds in build-bench/ for the sandbox root
# $KEYMGR_BENCH_ROOT (default /tmp/keymgr-bench), the signed one with a key
# made for the run.
set -euo pipefail
cd "$(dirname "$0")/.."
# shellcheck source=bench/lib.sh
. bench/lib.sh
runs=${1:-21}
root=${KEYMGR_BENCH_ROOT:-/tmp/keymgr-bench}
out=build-bench
bash scripts/install-deps.sh
mkdir -p "$out" "$root/quorvan/hidden" "$root/quorvan/spool/log" "$root/signed-data"
openssl genpkey -algorithm ed25519 -out "$out/digest-key.pem"
openssl pkey -in "$out/digest-key.pem" -pubout -out "$out/digest-key.pub.pem"
for variant in unsigned signed; do
  key=()
  [ "$variant" = unsigned ] || key=(-DKEYMGR_DIGEST_PUBKEY="$PWD/$out/digest-key.pub.pem")
  cmake -S . -B "$out/$variant" -G Ninja -DCMAKE_BUILD_TYPE=Release -DBUILD_TESTING=OFF \
    -DKEYMGR_ROOT="$root" "${key[@]}" >/dev/null
  cmake --build "$out/$variant" --target keymgr keymgr-eeprom keymgr-mkdigest >/dev/null
done
eeprom=$out/unsigned/tools/keymgr-eeprom
"$eeprom" init
"$eeprom" write 4958 00000000
"$eeprom" write 5049 42

data=$root/signed-data
if [ ! -f "$data/done" ]; then
  head -c $((5000 * 4096)) /dev/urandom | split -b 4096 -a 4 -d - "$data/f"
  touch "$data/done"
fi
printf '%-16s %12s %12s %8s\n' "file set" "unsigned" "signed" "signed+"
for count in 50 5000; do
  find "$data" -name 'f*' | sort | awk -v n="$count" 'NR <= n' >"$root/quorvan/hidden/keymgr.list"
  "$out/unsigned/tools/keymgr-mkdigest" --root / --manifest "$root/quorvan/hidden/keymgr.list" \
    --output "$root/quorvan/hidden/keymgr.cb" --key "$out/digest-key.pem" --counter 1
  declare -A times=()
  for _ in $(seq "$runs"); do
    for variant in unsigned signed; do
      times[$variant]+="$(wall_ms "$out/$variant/cli/keymgr") "
    done
  done
  grep -qx "BN=OK" "$root/quorvan/spool/log/keymgr.log" || { echo "the signed run failed" >&2; exit 1; }
  awk -v set="$count x 4 KiB" -v plain="$(median_of "${times[unsigned]}")" \
    -v signed="$(median_of "${times[signed]}")" 'BEGIN {
      printf "%-16s %9.3f ms %9.3f ms %5.3f ms\n", set, plain, signed, signed - plain }'
  unset times
done
echo "medians of $runs paired runs, warm cache"
