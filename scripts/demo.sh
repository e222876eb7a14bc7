#!/usr/bin/env bash
# keymgr's two jobs, shown in a sandbox root on a development host: the boot
# verification of the protected files (their digests recorded, verified, one
# file altered), then the key material regenerated and proven against a
# software TPM, and what a tampered key file does. Lines that start with "=="
# or are indented are the demo's own; every other line is the system's.
set -euo pipefail
cd "$(dirname "$0")/.."

root=/tmp/keymgr-demo
build="build-demo"
jobs=${JOBS:-$(nproc)}
tcti="swtpm:path=$root/run/swtpm.sock"
hidden=$root/quorvan/hidden
log=$root/quorvan/spool/log/keymgr.log

# step HEADING [EXPLANATION...]: the demo's heading of what comes next.
step() {
  printf '\n== %s\n' "$1"
  shift
  for line; do printf '   %s\n' "$line"; done
}
show_log() {
  echo "   boot status log $log:"
  sed 's/^/     /' "$log"
}

step "installing what the demo needs: the build tools, swtpm and tpm2-tools"
bash scripts/install-deps.sh demo

step "building keymgr, kmm-host and keymgr-eeprom in $build/" \
  "every fixed path (/quorvan/..., the EEPROM image) lies under $root; a device build has no such prefix"
cmake -S . -B "$build" -G Ninja -DKEYMGR_ROOT="$root" -DKEYMGR_TCTI="$tcti" \
  -DBUILD_TESTING=OFF >/dev/null
cmake --build "$build" -j "$jobs"
keymgr="$build/cli/keymgr"
eeprom="$build/tools/keymgr-eeprom"
kmm_host="$build/tools/kmm-host"

step "a fresh sandbox: three files to protect, named in the manifest $hidden/keymgr.list"
if [ -f "$root/run/swtpm.pid" ]; then scripts/swtpm-fixture.sh stop "$tcti" >/dev/null; fi
rm -rf "$root"
mkdir -p "$hidden" "$root/quorvan/spool/log" "$root/etc" "$root/usr/bin" "$root/run"
printf 'hostname=demo-device\n' >"$root/etc/device.conf"
printf '#!/bin/sh\necho started\n' >"$root/usr/bin/startup.sh"
head -c 4096 /dev/urandom >"$root/usr/bin/firmware.bin"
printf '%s\n' "$root/etc/device.conf" "$root/usr/bin/startup.sh" "$root/usr/bin/firmware.bin" \
  >"$hidden/keymgr.list"
sed 's/^/     /' "$hidden/keymgr.list"

step "a blank EEPROM image, with the gate of the boot verification open" \
  "keymgr verifies only when the EEPROM enables it: the integrity-check control byte at 0x42" \
  "(mode 2 with the enable bit), or the SFE_003 bit of the security-feature word (sfe-conf)." \
  "Here the control byte opens the gate and SFE_003 stays clear."
"$eeprom" init
"$eeprom" write control 42
"$eeprom" write sfe-conf 00000000
echo "   keymgr-eeprom read control: $("$eeprom" read control)   read sfe-conf: $("$eeprom" read sfe-conf)"

step "keymgr hash: the SHA-256 of each listed file recorded in $hidden/keymgr.cb"
"$keymgr" hash
echo "   keymgr.cb: $(stat -c %s "$hidden/keymgr.cb") bytes, 32 per listed file"

step "keymgr log: the boot verification, with both digests of each file" \
  "\"SFE_003 - [0]\" is the security-feature test that every verification prints: 4 when SFE_003" \
  "is on, 0 when off. md_sha is the digest measured now, rd_sha the one recorded in keymgr.cb." \
  "They agree for every file, so the verdict is BN=OK, written to the boot status log."
status=0
"$keymgr" log || status=$?
echo "   exit status: $status"
show_log

step "a protected file altered, then keymgr, the plain boot run" \
  "The verdict becomes BN=FAIL. The exit status stays 0: boot scripts read the verdict in the log."
printf 'hostname=tampered\n' >"$root/etc/device.conf"
status=0
"$keymgr" || status=$?
echo "   exit status: $status"
show_log

step "keymgr file PATH: that file checked alone" \
  "md_sha, its digest now, no longer matches rd_sha, the one recorded."
"$keymgr" file "$root/etc/device.conf"

step "key management: a software TPM (swtpm) at $root/run/swtpm.sock stands in for the device's"
scripts/swtpm-fixture.sh start "$tcti"
trap 'scripts/swtpm-fixture.sh stop "$tcti" >/dev/null' EXIT

step "SFE_003 on, so that the key check writes its DT line to the log as well" \
  "Then the altered file accepted (keymgr hash) and a boot run: the log starts anew with BN=OK."
"$eeprom" write sfe-conf 04000000
echo "   keymgr-eeprom read sfe-conf: $("$eeprom" read sfe-conf)"
"$keymgr" hash
"$keymgr"

step "kmm-host 3: the key material regenerated" \
  "A new secret key, kept in the EEPROM enciphered under a one-off key (the 48-byte store key);" \
  "the one-off key sealed by a new TPM key, whose identity and password are in the key files;" \
  "the SC digest of the secret key, in the EEPROM and in keymgr.cs, to prove it at boot."
status=0
"$kmm_host" 3 || status=$?
echo "   exit status: $status"
echo "   keymgr-eeprom read store-key: $("$eeprom" read store-key)"
echo "   keymgr-eeprom read sc-digest: $("$eeprom" read sc-digest)"
for f in keymgr.cs keymgr.hddkeyid keymgr.hddpwd keymgr.ook; do
  echo "   $hidden/$f: $(stat -c %s "$hidden/$f") bytes"
done
echo "   kmm-host keys (this system's keys in the TPM; \"named\": the one keymgr.hddkeyid names):"
"$kmm_host" keys | sed 's/^/     /'

step "kmm-host 1 1: the proof of the key material, as at the next boot" \
  "The one_off_key line is the one-off key the TPM unsealed: a diagnostic of test and demo" \
  "builds, which a production build (scripts/package.sh, KEYMGR_REDACT_OOK) prints as ** bytes." \
  "The secret key it deciphers from the store key hashes to the recorded SC digest: DT=OK," \
  "appended to the log."
"$kmm_host" 1 1
show_log

step "keymgr.hddpwd, the TPM key's password, altered, and the proof again" \
  "The TPM refuses to unseal the one-off key, so the flow goes on with the module's fixed" \
  "initial value (the one_off_key line now), which opens no store key: DT=FAIL, exit status 1."
pwd_file="$hidden/keymgr.hddpwd"
first=$(od -An -tu1 -N1 "$pwd_file" | tr -d ' ')
printf '%b' "\\x$(printf %02x $((first ^ 0xFF)))" | dd of="$pwd_file" bs=1 conv=notrunc status=none
status=0
"$kmm_host" 1 1 || status=$?
echo "   exit status: $status"
show_log

step "what the demo left"
for item in \
  "$root|the sandbox root; the protected files in etc/ and usr/bin/" \
  "$hidden|manifest, digest file, key files (keymgr.hddpwd altered)" \
  "$log|the boot status log" \
  "$root/sys/bus/i2c/devices/0-0050/eeprom|the EEPROM image" \
  "$root/run/swtpm-state|the software TPM's state with the key (swtpm is stopped)" \
  "$build/|the programs, built for this sandbox"; do
  printf '   %-50s %s\n' "${item%%|*}" "${item#*|}"
done

step "to try next"
sed 's/^/   /' <<EOF
# the sealed store key, or another region of the EEPROM map (keymgr-eeprom(8))
$eeprom read store-key
# another protected file altered, and the verification
echo x >>$root/usr/bin/startup.sh; $keymgr log
# the software TPM started again on its state, for kmm-host
swtpm socket --tpm2 --server type=unixio,path=$root/run/swtpm.sock \\
  --ctrl type=unixio,path=$root/run/swtpm.sock.ctrl --tpmstate dir=$root/run/swtpm-state \\
  --flags not-need-init,startup-clear --pid file=$root/run/swtpm.pid --daemon
# this system's keys in the TPM
$kmm_host keys
# the failing proof again, each failure underneath named on standard error
KEYMGR_DEBUG=1 $kmm_host 1 1
# new key material, proven: DT=OK
$kmm_host 3 && $kmm_host 1 1
# the software TPM stopped
scripts/swtpm-fixture.sh stop $tcti
EOF
echo "   README.md, docs/ and the man pages in dist/man/ tell the rest."
