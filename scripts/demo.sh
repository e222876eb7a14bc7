#!/usr/bin/env bash
# Demonstrates a boot run of keymgr in a sandbox root on a development host:
# build, prepare the EEPROM image and the protected files, record their
# digests, verify them, then alter one and verify again.
set -euo pipefail
cd "$(dirname "$0")/.."

root=/tmp/keymgr-demo
build="build-demo"
jobs=${JOBS:-$(nproc)}

echo "== Installing missing build dependencies (if any)"
bash scripts/install-deps.sh

echo "== Building keymgr in $build/ with every fixed path under $root"
tcti="swtpm:path=$root/run/swtpm.sock"
cmake -S . -B "$build" -G Ninja -DKEYMGR_ROOT="$root" -DKEYMGR_TCTI="$tcti" \
  -DBUILD_TESTING=OFF >/dev/null
cmake --build "$build" -j "$jobs"
keymgr="$build/cli/keymgr"
eeprom="$build/tools/keymgr-eeprom"
kmm_host="$build/tools/kmm-host"

echo "== Creating a fresh sandbox in $root"
if [ -f "$root/run/swtpm.pid" ]; then scripts/swtpm-fixture.sh stop "$tcti" >/dev/null; fi
rm -rf "$root"
mkdir -p "$root/quorvan/hidden" "$root/quorvan/spool/log" "$root/etc" "$root/usr/bin"
printf 'hostname=demo-device\n' >"$root/etc/device.conf"
printf '#!/bin/sh\necho started\n' >"$root/usr/bin/startup.sh"
head -c 4096 /dev/urandom >"$root/usr/bin/firmware.bin"
printf '%s\n' "$root/etc/device.conf" "$root/usr/bin/startup.sh" "$root/usr/bin/firmware.bin" \
  >"$root/quorvan/hidden/keymgr.list"
echo "Manifest $root/quorvan/hidden/keymgr.list lists:"
sed 's/^/  /' "$root/quorvan/hidden/keymgr.list"

echo "== Writing a blank EEPROM image and opening the gate"
echo "   (control byte at 5049 = 0x42: mode 2 with the enable bit; SFE_003 left clear)"
"$eeprom" init
"$eeprom" write 5049 42
"$eeprom" write 4958 00000000
echo "Control byte: $("$eeprom" read 5049 1)   SFE CONF word: $("$eeprom" read 4958 4)"

echo "== Recording the digests: keymgr hash"
"$keymgr" hash
echo "Digest file $root/quorvan/hidden/keymgr.cb holds $(stat -c %s "$root/quorvan/hidden/keymgr.cb") bytes (32 per entry)"

echo "== Boot verification, verbose: keymgr log"
status=0
"$keymgr" log || status=$?
echo "Exit status: $status"
echo "Boot status log $root/quorvan/spool/log/keymgr.log:"
cat "$root/quorvan/spool/log/keymgr.log"

echo "== Altering $root/etc/device.conf and running the boot verification again (keymgr)"
printf 'hostname=tampered\n' >"$root/etc/device.conf"
status=0
"$keymgr" || status=$?
echo "Exit status: $status (a corrupted file is reported in the log, not in the status)"
echo "Boot status log:"
cat "$root/quorvan/spool/log/keymgr.log"

echo "== Checking the altered file by hand: keymgr file PATH"
"$keymgr" file "$root/etc/device.conf"

# ---------------------------------------------------------------------------
# Key management: KeyManage through the example host kmm-host, against a
# software TPM (swtpm) standing in for the device's TPM.
# ---------------------------------------------------------------------------

echo "== Starting a software TPM at $root/run/swtpm.sock"
mkdir -p "$root/run"
scripts/swtpm-fixture.sh start "$tcti"
trap 'scripts/swtpm-fixture.sh stop "$tcti" >/dev/null' EXIT

echo "== Turning SFE_003 on (SFE CONF word at 4958 = 4), so the key check logs its DT line"
"$eeprom" write 4958 04000000
echo "== Accepting the altered file (keymgr hash) and booting again: the log starts with BN=OK"
"$keymgr" hash
"$keymgr"

echo "== Regenerating the key material: kmm-host 3"
status=0
"$kmm_host" 3 || status=$?
echo "Exit status: $status"
echo "Store key in EEPROM at 4244: $("$eeprom" read 4244 48)"
echo "SC digest in EEPROM at 32256: $("$eeprom" read 32256 32)"
for f in keymgr.cs keymgr.hddkeyid keymgr.hddpwd keymgr.ook; do
  echo "  $root/quorvan/hidden/$f: $(stat -c %s "$root/quorvan/hidden/$f") bytes"
done
echo "Persistent TPM keys: $(tpm2_getcap handles-persistent -T "$tcti" | tr '\n' ' ')"

echo "== Normal boot proof with logging: kmm-host 1 1"
"$kmm_host" 1 1
echo "Boot status log:"
cat "$root/quorvan/spool/log/keymgr.log"

echo "== Altering keymgr.hddpwd (the TPM key's password) and proving again"
pwd_file="$root/quorvan/hidden/keymgr.hddpwd"
first=$(od -An -tu1 -N1 "$pwd_file" | tr -d ' ')
printf '%b' "\\x$(printf %02x $((first ^ 0xFF)))" | dd of="$pwd_file" bs=1 conv=notrunc status=none
status=0
"$kmm_host" 1 1 || status=$?
echo "Exit status: $status"
echo "Boot status log:"
cat "$root/quorvan/spool/log/keymgr.log"

echo "== Demo finished"
