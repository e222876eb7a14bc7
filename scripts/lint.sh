#!/usr/bin/env bash
# Static analysis of the product code: clang-tidy with the checked-in
# .clang-tidy, then cppcheck, both over the compile commands of a product
# build configured in build-lint/; then shellcheck over the scripts. Fails on
# any finding.
set -euo pipefail
cd "$(dirname "$0")/.."
echo "== installing what the checks need =="
bash scripts/install-deps.sh lint

build="build-lint"
echo "== configuring $build/ =="
# A signed, measured and sealed build (the test key), so that the code of
# every opt-in build is analysed too.
cmake -S . -B "$build" -G Ninja -DBUILD_TESTING=OFF -DCMAKE_EXPORT_COMPILE_COMMANDS=ON \
  -DKEYMGR_DIGEST_PUBKEY="$PWD/tests/cli/data/digest_key.pub.pem" -DKEYMGR_MEASURE_PCR=14 \
  -DKEYMGR_SEAL_TO_VERDICT=ON -DKEYMGR_POLICY_PUBKEY="$PWD/tests/policy/data/vendor_key.pub.pem" \
  >/dev/null

echo "== clang-tidy"
log=$build/clang-tidy.log
if ! run-clang-tidy -p "$build" -quiet -j "$(nproc)" \
    "^$PWD/(util|crypto|verdict|policy|eeprom|tpm|bootlog|integrity|kmm|cli|tools)/" >"$log" 2>&1; then
  grep -v -E '^(clang-tidy|[0-9]+ warnings? generated|Suppressed [0-9]+ warnings|Use -header-filter)' \
    "$log" >&2
  echo "clang-tidy: findings above" >&2
  exit 1
fi

echo "== cppcheck"
cppcheck --project="$build/compile_commands.json" --enable=warning,portability,performance \
  --std=c++20 --inline-suppr --error-exitcode=1 --quiet -j "$(nproc)"
echo "== shellcheck"
shellcheck scripts/*.sh scripts/vm/*.sh scripts/vm/rows/*.sh bench/*.sh tests/dist/*.sh .ci/run \
  dist/buildroot/*.sh dist/initramfs/keymgr-root.sh dist/initramfs/hooks/keymgr \
  dist/initramfs/scripts/local-bottom/keymgr
echo "lint: clean"
