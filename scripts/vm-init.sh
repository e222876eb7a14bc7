#!/bin/sh
# shellcheck shell=dash
# /init of the VM test's guest (scripts/vm-test.sh puts it in the initramfs).
# It brings up what a device's early boot has: the kernel's TPM driver, the
# disk that holds /quorvan and the EEPROM image, and the image at the
# EEPROM's sysfs path (this kernel has no I2C, so a tmpfs over /sys/bus
# carries the path). Then it runs the installed boot script as a device's
# init does, and the checks of the boot that the kernel command line names:
#   vmtest_row=NAME             the row (see the case at the end; "shell"
#                               gives a shell after the boot script)
#   vmtest_tcti=TCTI            provision: the transport kmm-host was built for
#   vmtest_sealed=1             the build measures its verdict into PCR 14 and
#                               seals the key to it
#   vmtest_cut=I vmtest_cuts=N  cut rows: cut the power at point I of N
#   vmtest_op=kmm|hash          cut rows: the operation to cut
#   vmtest_finished=1           cut rows: the host saw the previous boot's
#                               operation finish before the cut
# Each check prints "vmtest: ok WHAT" or "vmtest: FAIL WHAT" on the console.
# A boot that ends normally prints "vmtest: done" and powers off; a power cut
# reboots at once without syncing, so the page cache is lost. QEMU runs with
# -no-reboot: either way it exits.

/bin/busybox --install -s
export PATH=/usr/sbin:/usr/bin:/sbin:/bin
mount -t proc proc /proc
mount -t sysfs sysfs /sys
mount -t devtmpfs devtmpfs /dev
mount -t tmpfs tmpfs /tmp

row=${vmtest_row:-none}
cut_op=${vmtest_op:-}
cut_index=${vmtest_cut:-0}
cut_count=${vmtest_cuts:-1}
finished=${vmtest_finished:-}
vmtest_tcti=${vmtest_tcti:-}
sealed=${vmtest_sealed:-}
events=/quorvan/spool/log/keymgr.events
hidden=/quorvan/hidden
log=/quorvan/spool/log/keymgr.log
# What the test keeps on the disk between boots, beside /quorvan.
state=/disk/vmtest
# SHA-256 of "keymgr: sealing key of the one-off key": the authPolicy that
# marks a TPM key of this system.
marker=6d922afdc6eca3f86bc5a593a1939a340ce7299b0e44810d2678c87b016584d6

ok() { echo "vmtest: ok $*"; }
bad() { echo "vmtest: FAIL $*"; }
# check WHAT COMMAND...: one check, passed when COMMAND succeeds.
check() {
  local what=$1
  shift
  if "$@"; then ok "$what"; else bad "$what"; fi
}

finish() {
  echo "vmtest: done"
  cd /
  umount /quorvan /disk 2>/dev/null || sync
  poweroff -f
}

# wait_for PATH: up to 5 s for a device node to appear.
wait_for() {
  local n=0
  while [ ! -e "$1" ]; do
    n=$((n + 1))
    [ $n -le 500 ] || return 1
    usleep 10000
  done
}

now_ms() {
  local up
  read -r up _ </proc/uptime
  echo $((${up%.*} * 1000 + 1${up#*.}0 - 1000))
}

# --- Bring-up ---------------------------------------------------------------
while read -r module; do
  insmod "/lib/modules/$module.ko" || bad "insmod $module"
done </lib/modules/load-order
wait_for /dev/vda || bad "the disk /dev/vda appears"
wait_for /dev/tpmrm0 || bad "the TPM's /dev/tpmrm0 appears"
[ -e /dev/tpm0 ] || bad "the TPM's /dev/tpm0 appears"
mkdir -p /disk /quorvan
mount -t ext4 /dev/vda /disk || bad "the disk mounts"
mount --bind /disk/quorvan /quorvan
mkdir -p "$state"
# The devices folder is a tmpfs of links, as in sysfs; the row that has no
# EEPROM leaves the link out.
mount -t tmpfs tmpfs /sys/bus
mkdir -p /sys/bus/i2c/devices
[ "$row" = no-eeprom ] || ln -s /disk/eeprom /sys/bus/i2c/devices/0-0050

# --- Helpers ----------------------------------------------------------------
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

hex_of() { od -An -tx1 -v "$@" | tr -d ' \n'; }

# tpm HEXBYTES...: sends one command to the TPM through the kernel's
# resource manager and prints the response in hex.
tpm() {
  local byte
  for byte; do printf '%b' "\\0$(printf %03o "0x$byte")"; done >/tmp/tpm.cmd
  # A failed redirection of exec would end the shell, and init with it.
  [ -c /dev/tpmrm0 ] || return 1
  exec 3<>/dev/tpmrm0
  # One write is one command; one read is its whole response.
  dd if=/tmp/tpm.cmd bs=4096 count=1 2>/dev/null >&3
  dd bs=4096 count=1 2>/dev/null <&3 | hex_of
  exec 3<&-
}

# own_keys: the persistent handles of this system's keys in the TPM (the
# owner range from 0x81020000 up, the marker as authPolicy), one a line.
own_keys() {
  local caps count i handle public
  # TPM2_GetCapability(TPM_CAP_HANDLES, 0x81020000, 64)
  caps=$(tpm 80 01 00 00 00 16 00 00 01 7a 00 00 00 01 81 02 00 00 00 00 00 40)
  [ "$(echo "$caps" | cut -c13-22)" = 0000000000 ] || { echo "GetCapability: $caps"; return 1; }
  count=$((0x$(echo "$caps" | cut -c31-38)))
  i=0
  while [ $i -lt "$count" ]; do
    handle=$(echo "$caps" | cut -c$((39 + 8 * i))-$((46 + 8 * i)))
    i=$((i + 1))
    [ $((0x$handle)) -le $((0x817fffff)) ] || continue
    # TPM2_ReadPublic(handle): the authPolicy follows type, nameAlg and
    # objectAttributes.
    # shellcheck disable=SC2046 # one word per byte
    public=$(tpm 80 01 00 00 00 0e 00 00 01 73 $(echo "$handle" | sed 's/../& /g'))
    [ "$(echo "$public" | cut -c13-20)" = 00000000 ] || { echo "ReadPublic: $public"; return 1; }
    [ "$(echo "$public" | cut -c41-108)" != "0020$marker" ] || echo "$handle"
  done
}

# named_key: the handle of the key that keymgr.hddkeyid names: the first
# three bytes of the MD5 of the identity's upper-case hex text, folded into
# the range from 0x81020000 to 0x817fffff.
named_key() {
  local digest
  digest=$(printf %s "$(hex_of "$hidden/keymgr.hddkeyid" | tr a-f A-F)" | md5sum | cut -c1-6)
  printf '%08x\n' $((0x81020000 + 0x$digest % 0x7e0000))
}

# keys_are WHAT HANDLES: the TPM holds exactly these keys of this system.
keys_are() {
  local got
  got=$(own_keys | tr '\n' ' ')
  got=${got% }
  if [ "$got" = "$2" ]; then
    ok "$1: TPM keys of this system: ${got:-none}"
  else
    bad "$1: TPM keys of this system: ${got:-none}, expected: ${2:-none}"
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
  keys_are "after the regeneration" "$(named_key)"
}

# flip_byte FILE: inverts the first byte of FILE in place.
flip_byte() {
  local byte
  byte=$(od -An -tu1 -N1 "$1" | tr -d ' ')
  printf '%b' "\\0$(printf %03o $((byte ^ 255)))" | dd of="$1" bs=1 count=1 conv=notrunc 2>/dev/null
}

# --- Power cuts -------------------------------------------------------------
# The key material that a regeneration replaces, in the order it writes it:
# the SC digest in the EEPROM, its disk copy, the key files, the store key.
kmm_items="eeprom-sc-digest keymgr.cs keymgr.hddkeyid keymgr.hddpwd keymgr.ook eeprom-store-key"

# item_now ITEM: the item's current bytes, in hex.
item_now() {
  case "$1" in
    # Offsets and lengths of the SC digest and the store key.
    eeprom-sc-digest) keymgr-eeprom read 32256 32 | tr -d ' ' ;;
    eeprom-store-key) keymgr-eeprom read 4244 48 | tr -d ' ' ;;
    *) hex_of "$hidden/$1" ;;
  esac
}

# whole_new OLD NEW: NEW (hex) is a whole other version of OLD: as long, not
# the same, not all zeros (what a file whose data never reached the disk
# shows).
whole_new() {
  [ "${#2}" = "${#1}" ] && [ "$2" != "$1" ] && [ -n "$(echo "$2" | tr -d 0)" ]
}

# snapshot: keeps /quorvan/hidden and the key material in the EEPROM as
# they are before a cut operation.
snapshot() {
  local item
  rm -rf "$state/old"
  cp -a "$hidden" "$state/old"
  for item in $kmm_items; do item_now "$item" >"$state/old.$item"; done
}

# unchanged_besides NAMES...: every file under /quorvan/hidden but NAMES
# (and temporary names) is there and as before the cut, and none is new.
unchanged_besides() {
  local file name
  for file in "$state"/old/* "$hidden"/*; do
    name=${file##*/}
    case " $* " in *" $name "*) continue ;; esac
    cmp -s "$state/old/$name" "$hidden/$name" || { echo "vmtest: note $name changed"; return 1; }
  done
}

# The manifest of the hash cuts: the protected files, a few thousand data
# files and, last, a file that each cut round changes, so that the new
# digest file differs from the old one in its last record only.
generation=/quorvan/protected/generation

# leftovers_whole: a temporary name left by a cut between link and rename
# holds a whole file, as long as the one it was to replace.
leftovers_whole() {
  local temp target
  for temp in "$hidden"/.*.new; do
    [ -e "$temp" ] || continue
    target=${temp#"$hidden"/.}
    target=$hidden/${target%.new}
    echo "vmtest: note leftover ${temp#"$hidden"/} ($(wc -c <"$temp") bytes)"
    [ "$(wc -c <"$temp")" = "$(wc -c <"$target")" ] || return 1
  done
}

# check_kmm_cut: the boot after a cut regeneration. Each item is the old
# version or a whole new one; the new ones are a prefix of the write order;
# the boot proof's verdict follows: all new proves, a mix fails, all old
# proves while the old TPM key is still there.
check_kmm_cut() {
  local item old new pattern="" left="" torn=0 dt expect
  for item in $kmm_items; do
    old=$(cat "$state/old.$item")
    new=$(item_now "$item")
    if [ "$new" = "$old" ]; then
      pattern=${pattern}O
      left="$left $item=old"
    elif whole_new "$old" "$new"; then
      pattern=${pattern}N
      left="$left $item=new"
    else
      torn=1
      left="$left $item=TORN"
    fi
  done
  check "cut $cut_info: every item old or whole new:$left" [ $torn = 0 ]
  check "cut $cut_info: the new items are the first ones written ($pattern)" \
    [ "${pattern#*O*N}" = "$pattern" ]
  [ -z "$finished" ] || check "cut $cut_info: all is new, as the regeneration had finished" \
    [ "$pattern" = NNNNNN ]
  check "cut $cut_info: no torn leftover in $hidden" leftovers_whole
  check "cut $cut_info: the other files in $hidden are as before" \
    unchanged_besides keymgr.cs keymgr.hddkeyid keymgr.hddpwd keymgr.ook
  dt=$(tail -n 1 "$log")
  case "$pattern" in
    NNNNNN) expect=DT=OK ;;
    OOOOOO) if own_keys | grep -qx "$(named_key)"; then expect=DT=OK; else expect=DT=FAIL; fi ;;
    *) expect=DT=FAIL ;;
  esac
  check "cut $cut_info: boot proof $dt, expected $expect" [ "$dt" = "$expect" ]
  check "cut $cut_info: boot script exit status $boot_status matches $dt" \
    [ "$boot_status" = "$([ "$dt" = DT=OK ] && echo 0 || echo 1)" ]
  echo "vmtest: cut-left kmm $pattern $dt${finished:+ (after the end)}"
}

# check_hash_cut: the boot after a cut keymgr hash. The digest file is the
# old one (and the boot fails the changed file) or the whole new one (and the
# boot passes).
check_hash_cut() {
  local left bn expect records
  records=$(($(wc -c <"$state/old/keymgr.cb") / 32 - 1))
  bn=$(head -n 1 "$log")
  if cmp -s "$state/old/keymgr.cb" "$hidden/keymgr.cb"; then
    left=old
    expect=BN=FAIL
  elif [ "$(wc -c <"$hidden/keymgr.cb")" = "$(wc -c <"$state/old/keymgr.cb")" ] &&
    [ "$(head -c $((32 * records)) "$hidden/keymgr.cb" | md5sum)" = \
      "$(head -c $((32 * records)) "$state/old/keymgr.cb" | md5sum)" ] &&
    [ "$(tail -c 32 "$hidden/keymgr.cb" | hex_of)" = "$(sha256sum "$generation" | cut -c1-64)" ]; then
    left=new
    expect=BN=OK
  else
    left=TORN
    expect="the BN line of a whole digest file"
  fi
  check "cut $cut_info: keymgr.cb is the old or the whole new one: $left" [ "$left" != TORN ]
  [ -z "$finished" ] || check "cut $cut_info: keymgr.cb is new, as keymgr hash had finished" \
    [ "$left" = new ]
  check "cut $cut_info: no torn leftover in $hidden" leftovers_whole
  check "cut $cut_info: the other files in $hidden are as before" unchanged_besides keymgr.cb
  check "cut $cut_info: $bn, expected $expect for the $left digest file" [ "$bn" = "$expect" ]
  check "cut $cut_info: key material untouched, boot proof DT=OK" [ "$(tail -n 1 "$log")" = DT=OK ]
  boot_status_is 0
  echo "vmtest: cut-left hash $left $bn${finished:+ (after the end)}"
}

# cut_after MS COMMAND...: starts COMMAND and cuts the power MS ms later.
# When COMMAND ends first, the console says so: the host then tells the next
# boot that all it wrote must be there.
cut_after() {
  local ms=$1
  shift
  sync
  { "$@" >/dev/null 2>&1 && echo "vmtest: finished before the cut"; } &
  usleep $((ms * 1000))
  echo b >/proc/sysrq-trigger
}

# cut_row: the boot of a power-cut series. It checks what the previous
# boot's cut left, proves that a regeneration and a boot then succeed, and
# makes the next cut, if any, at point cut_index of cut_count, spread from
# 6% to 120% of the operation's time as measured just before: the last
# points fall after its end, when all it wrote must be there.
cut_row() {
  local op ms duration
  if [ -f "$state/cut" ]; then
    read -r op cut_info <"$state/cut"
    rm -f "$state/cut"
    check "cut $cut_info: the image of the EEPROM is whole" [ "$(wc -c </disk/eeprom/eeprom)" = 32768 ]
    if [ "$op" = kmm ]; then check_kmm_cut; else check_hash_cut; fi
  fi
  regenerate_and_boot
  [ -n "$cut_op" ] || return 0
  if [ "$cut_op" = kmm ]; then
    # The regeneration above timed the operation.
    duration=$regen_ms
  else
    if [ ! -f "$state/hash-series" ]; then
      # The series' start: the larger manifest and its digest file, which
      # also brings the files into the page cache, as the boot's
      # verification does at every later cut.
      { cat "$state/manifest" && find /quorvan/data -type f | sort && echo "$generation"; } \
        >"$hidden/keymgr.list"
      run "keymgr hash over $(wc -w <"$hidden/keymgr.list") files" 0 keymgr hash
      : >"$state/hash-series"
    fi
    ms=$(now_ms)
    run "keymgr hash (timed)" 0 keymgr hash
    duration=$(($(now_ms) - ms))
    echo "round $cut_index" >"$generation"
  fi
  snapshot
  ms=$((duration * cut_index * 12 / (10 * cut_count)))
  cut_info="$cut_op $cut_index/$cut_count at ${ms} ms of ${duration} ms"
  echo "$cut_op $cut_info" >"$state/cut"
  echo "vmtest: cutting the power: $cut_info"
  if [ "$cut_op" = kmm ]; then
    cut_after "$ms" kmm-host 3
  else
    cut_after "$ms" keymgr hash
  fi
}

proof_runs() { pidof kmm-host >/dev/null; }

# --- Rows -------------------------------------------------------------------
case "$row" in
  provision)
    check "kmm-host talks to the TPM through $vmtest_tcti" \
      sh -c "strings /usr/bin/kmm-host | grep -qx '$vmtest_tcti'"
    # The boot script finds nothing to verify yet.
    run_boot_script
    log_is
    run "keymgr-eeprom init" 0 keymgr-eeprom init
    # The integrity check's control byte (mode 2, enabled) and SFE_003, so
    # that the key check logs its DT line.
    run "keymgr-eeprom write control byte" 0 keymgr-eeprom write 5049 42
    run "keymgr-eeprom write SFE word" 0 keymgr-eeprom write 4958 04000000
    cp "$state/manifest" "$hidden/keymgr.list"
    run "keymgr hash" 0 keymgr hash
    check "keymgr.cb holds a record per listed file" \
      [ "$(wc -c <"$hidden/keymgr.cb")" = $((32 * $(wc -w <"$hidden/keymgr.list"))) ]
    keys_are "before the first regeneration" ""
    if [ -n "$sealed" ]; then
      # This boot measured a verdict of nothing: the key opens only after
      # the next boot's good verdict.
      run "regeneration (kmm-host 3)" 0 kmm-host 3
      run "boot proof (kmm-host 1 1) before a good verdict" 1 kmm-host 1 1
    else
      regenerate_and_boot
    fi
    ;;
  normal)
    run_boot_script
    boot_status_is 0
    log_is BN=OK DT=OK
    [ -z "$sealed" ] || check "the event log holds the verdict BN=OK" grep -q '"verdict":"BN=OK"' "$events"
    ;;
  file-altered)
    cp /quorvan/protected/device.conf /tmp/device.conf
    echo "altered" >>/quorvan/protected/device.conf
    run_boot_script
    if [ -n "$sealed" ]; then
      # The key needs the good verdict.
      boot_status_is 1
      log_is BN=FAIL DT=FAIL
      check "the event log holds the verdict BN=FAIL" grep -q '"verdict":"BN=FAIL"' "$events"
    else
      boot_status_is 0
      log_is BN=FAIL DT=OK
    fi
    cp /tmp/device.conf /quorvan/protected/device.conf
    ;;
  key-altered)
    cp "$hidden/keymgr.hddpwd" /tmp/keymgr.hddpwd
    flip_byte "$hidden/keymgr.hddpwd"
    run_boot_script
    boot_status_is 1
    log_is BN=OK DT=FAIL
    cp /tmp/keymgr.hddpwd "$hidden/keymgr.hddpwd"
    ;;
  no-eeprom)
    # The previous boot logged BN=OK; this one verifies nothing.
    check "the previous boot's BN=OK is there before the boot script" grep -qx BN=OK "$log"
    run_boot_script
    boot_status_is 1
    log_is
    ;;
  fresh-tpm)
    run_boot_script
    boot_status_is 1
    log_is BN=OK DT=FAIL
    keys_are "a fresh TPM" ""
    ;;
  regenerate)
    run_boot_script
    boot_status_is 0
    log_is BN=OK DT=OK
    old_key=$(named_key)
    keys_are "before" "$old_key"
    regenerate_and_boot
    check "the new key replaced the old one" [ "$(named_key)" != "$old_key" ]
    log_is BN=OK DT=OK DT=OK
    ;;
  panic)
    # A kernel panic while the boot proof runs, after keymgr has logged.
    /etc/init.d/keymgr-boot start >/dev/null 2>&1 &
    n=0
    until proof_runs || [ $n -ge 1000 ]; do
      n=$((n + 1))
      usleep 5000
    done
    check "kmm-host runs: panicking now" proof_runs
    echo c >/proc/sysrq-trigger
    ;;
  after-panic)
    run_boot_script
    boot_status_is 0
    log_is BN=OK DT=OK
    keys_are "after the panic" "$(named_key)"
    ;;
  cut)
    run_boot_script
    cut_row
    ;;
  shell)
    # For a boot by hand: the boot script, then a shell on the console.
    run_boot_script
    echo "boot script exit status $boot_status; $log holds:"
    cat "$log" 2>/dev/null
    echo "exit the shell to power off"
    setsid cttyhack sh
    ;;
  *)
    bad "unknown row $row"
    ;;
esac
finish
