#!/usr/bin/env bash
# Builds the libFuzzer harnesses (clang, ASan and UBSan) in build-fuzz/ and
# runs each for SECONDS (default 30), one after another, from its seeds in
# tests/fuzz/corpus/<name>/.
#   scripts/fuzz.sh [SECONDS]
# KEYMGR_FUZZ_ROOT overrides the sandbox root the harnesses write under
# (default /dev/shm/keymgr-fuzz: a tmpfs keeps their file writes cheap; at
# most 40 characters). Inputs that find new paths are kept in
# build-fuzz/corpus/<name>/. A crash, a sanitizer report or an input that runs
# longer than 10 s leaves the input in build-fuzz/ and fails the script.
set -euo pipefail
cd "$(dirname "$0")/.."
echo "== installing what the fuzzers need =="
bash scripts/install-deps.sh fuzz

seconds=${1:-30}
build="build-fuzz"
root=${KEYMGR_FUZZ_ROOT:-/dev/shm/keymgr-fuzz}

echo "== building the harnesses in $build/ =="
cmake -S . -B "$build" -G Ninja -DCMAKE_C_COMPILER=clang -DCMAKE_CXX_COMPILER=clang++ \
  -DKEYMGR_FUZZ=ON -DBUILD_TESTING=OFF -DKEYMGR_ROOT="$root"
cmake --build "$build" -j "$(nproc)"

# Each harness has its seeds; a harness left in the build folder by an older
# tree has none and is not run.
for corpus in tests/fuzz/corpus/*/; do
  name=$(basename "$corpus")
  harness=$build/fuzz/fuzz_$name
  mkdir -p "$build/corpus/$name"
  echo "== fuzz_$name, ${seconds} s"
  "$harness" -max_total_time="$seconds" -timeout=10 -print_final_stats=1 \
    -artifact_prefix="$build/fuzz_$name-" "$build/corpus/$name" "tests/fuzz/corpus/$name"
done
