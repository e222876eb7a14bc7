# shellcheck shell=dash
# What the VM test's rows share (scripts/vm/rows/*.sh source it; so does
# /init). Each check prints "vmtest: ok WHAT" or "vmtest: FAIL WHAT" on the
# console, where scripts/vm-test.sh counts it. Whatever the TPM and the
# EEPROM hold is asked of the product's own tools: kmm-host keys and
# keymgr-eeprom.

# shellcheck disable=SC2034 # the rows use these
events=/quorvan/spool/log/keymgr.events
hidden=/quorvan/hidden
log=/quorvan/spool/log/keymgr.log
# What the test keeps on the disk between boots, beside /quorvan.
state=/disk/vmtest
# The chain rows: the PCR values that the vendor's policy of the release on
# the disk binds, as keymgr-mkpolicy printed them on the host.
policy_pcr4=${vmtest_pcr4:-}
policy_pcr12=${vmtest_pcr12:-}
policy_pcr14=${vmtest_pcr14:-}

ok() { echo "vmtest: ok $*"; }
bad() { echo "vmtest: FAIL $*"; }
# check WHAT COMMAND...: one check, passed when COMMAND succeeds.
check() {
  local what=$1
  shift
  if "$@"; then ok "$what"; else bad "$what"; fi
}

now_ms() {
  local up
  read -r up _ </proc/uptime
  echo $((${up%.*} * 1000 + 1${up#*.}0 - 1000))
}

hex_of() { od -An -tx1 -v "$@" | tr -d ' \n'; }

# pcr N: PCR N of the TPM's SHA-256 bank as the kernel reads it, in
# lower-case hex.
pcr() { tr 'A-F' 'a-f' <"/sys/class/tpm/tpm0/pcr-sha256/$1"; }

# log_is LINES...: the boot status log holds exactly these lines.
log_is() {
  local got="" want="$*"
  [ ! -e "$log" ] || got=$(tr '\n' ' ' <"$log")
  got=${got% }
  if [ "$got" = "$want" ]; then
    ok "log is: ${want:-(no log)}"
  else
    bad "log is: ${got:-(no log)}, expected: ${want:-(no log)}"
  fi
}

# run_boot_script: what a device's init does at boot. Its status is left in
# boot_status, its output in /tmp/boot.out.
run_boot_script() {
  /etc/init.d/keymgr-boot start >/tmp/boot.out 2>&1
  boot_status=$?
}

# boot_status_is N: the boot script ended with status N.
boot_status_is() {
  if [ "$boot_status" = "$1" ]; then
    ok "boot script exits $1"
  else
    bad "boot script exits $boot_status, expected $1; its output ends:"
    tail -n 5 /tmp/boot.out
  fi
}

# run WHAT STATUS COMMAND...: COMMAND ends with STATUS (output in /tmp/run.out).
run() {
  local what=$1 want=$2 got
  shift 2
  "$@" >/tmp/run.out 2>&1
  got=$?
  if [ "$got" = "$want" ]; then
    ok "$what exits $want"
  else
    bad "$what exits $got, expected $want; its output ends:"
    tail -n 5 /tmp/run.out
  fi
}

# named_key: the handle of the key that keymgr.hddkeyid names, when the TPM
# holds it.
named_key() { kmm-host keys | sed -n 's/ named$//p'; }

# keys_are WHAT none|named: the TPM holds no key of this system, or exactly
# one, the one keymgr.hddkeyid names, as kmm-host keys lists them.
keys_are() {
  local keys status=0 want
  keys=$(kmm-host keys 2>&1) || status=$?
  if [ "$2" = named ]; then
    want="one, the one keymgr.hddkeyid names"
    [ "$(echo "$keys" | grep -c .)" = 1 ] && [ "${keys% named}" != "$keys" ] || status=1
  else
    want=none
    [ -z "$keys" ] || status=1
  fi
  keys=$(echo "$keys" | paste -sd, | sed 's/,/, /g')
  if [ $status = 0 ]; then
    ok "$1: TPM keys of this system: ${keys:-none}"
  else
    bad "$1: TPM keys of this system: ${keys:-none}, expected: $want"
  fi
}

# regenerate_and_boot: a regeneration and the boot proof succeed, and leave
# the TPM with one key of this system, the one the key files name. The
# regeneration's time in ms is left in regen_ms.
regenerate_and_boot() {
  local start
  start=$(now_ms)
  run "regeneration (kmm-host 3)" 0 kmm-host 3
  regen_ms=$(($(now_ms) - start))
  run "boot proof (kmm-host 1 1)" 0 kmm-host 1 1
  check "boot proof logs DT=OK" [ "$(tail -n 1 "$log")" = DT=OK ]
  keys_are "after the regeneration" named
}

# events_are VERDICT: the event log, as keymgr-eventlog reads it, is one
# boot's: the verdict VERDICT, then the separator of the boot's first key
# proof; and it replays to PCR 14 as the kernel reads it.
events_are() {
  local records status=0
  keymgr-eventlog "$events" --pcr 14 --expect "$(pcr 14)" >/tmp/events.out 2>&1 || status=$?
  records=$(sed -n 's/^[0-9] pcr 14 sha256:[0-9a-f]* //p' /tmp/events.out | paste -sd' ')
  if [ $status = 0 ] && [ "$records" = "$1 separator" ]; then
    ok "event log: $records, replayed to PCR 14 as read"
  else
    bad "event log: ${records:-nothing} (keymgr-eventlog exits $status), expected: $1 separator," \
      "replayed to PCR 14 as read"
    tail -n 3 /tmp/events.out
  fi
}
