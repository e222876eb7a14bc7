#!/bin/sh
# shellcheck shell=dash
# A boot of a power-cut series. It checks what the previous boot's cut left,
# proves that a regeneration and a boot then succeed, and makes the next cut,
# if any: part way through kmm-host 3 or keymgr hash, the power goes.
# shellcheck source=scripts/vm/lib.sh
. /usr/lib/vmtest/lib.sh

cut_op=${vmtest_op:-}
cut_index=${vmtest_cut:-0}
cut_count=${vmtest_cuts:-1}
finished=${vmtest_finished:-}
eeprom=/sys/bus/i2c/devices/0-0050/eeprom

# The key material that a regeneration replaces, in the order it writes it:
# the SC digest in the EEPROM, its disk copy, the key files, the store key.
kmm_items="sc-digest keymgr.cs keymgr.hddkeyid keymgr.hddpwd keymgr.ook store-key"

# item_now ITEM: the item's current bytes, in hex.
item_now() {
  case "$1" in
    keymgr.*) hex_of "$hidden/$1" ;;
    *) keymgr-eeprom read "$1" | tr -d ' ' ;;
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
    OOOOOO) if [ -n "$(named_key)" ]; then expect=DT=OK; else expect=DT=FAIL; fi ;;
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

run_boot_script
if [ -f "$state/cut" ]; then
  read -r op cut_info <"$state/cut"
  rm -f "$state/cut"
  check "cut $cut_info: the image of the EEPROM is whole" \
    [ "$(wc -c <"$eeprom")" = "$(cat "$state/eeprom-size")" ]
  if [ "$op" = kmm ]; then check_kmm_cut; else check_hash_cut; fi
fi
regenerate_and_boot
[ -n "$cut_op" ] || exit 0

# The next cut, at point cut_index of cut_count, spread from 6% to 120% of
# the operation's time as measured just before: the last points fall after
# its end, when all it wrote must be there.
if [ "$cut_op" = kmm ]; then
  # The regeneration above timed the operation.
  duration=$regen_ms
else
  if [ ! -f "$state/hash-series" ]; then
    # The series' start: the larger manifest and its digest file, which also
    # brings the files into the page cache, as the boot's verification does
    # at every later cut.
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
