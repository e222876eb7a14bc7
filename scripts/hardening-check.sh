#!/usr/bin/env bash
# Fails unless the built programs and shared library carry the release
# hardening, as Debian's hardening-check reads it: PIE, stack protector,
# fortified functions, read-only relocations, immediate binding, stack clash
# protection and control flow protection.
#   hardening-check.sh [--cf-in ARCHIVE | --no-cf] [--probe-in OBJECT] ELF...
# hardening-check reads control flow protection from the x86 IBT/SHSTK note
# of a linked file, which the linker drops when any input lacks it: where the
# C library's start files lack it (Debian 12), and on aarch64 (BTI/PAC), the
# note it looks for cannot be had, so --cf-in names an archive of this
# system's objects, each of which must carry its architecture's note
# instead. --no-cf: the architecture has no such protection (armhf).
# hardening-check finds stack clash protection only in a probing loop; the
# probes of frames deeper than the guard area are looked for here, in the
# ELF files and in --probe-in, an object built with the same options whose
# frame is deep enough on every architecture. READELF and OBJDUMP name the
# target's tools in a cross build.
set -euo pipefail
readelf=${READELF:-readelf}
objdump=${OBJDUMP:-objdump}
skip=()
probe_in=()
if [ "${1:-}" = "--cf-in" ]; then
  archive=$2
  shift 2
  skip=(--nocfprotection)
  notes=$("$readelf" -n "$archive")
  objects=$(grep -c '^File: ' <<<"$notes" || true)
  marked=$(grep -c -E 'x86 feature: IBT, SHSTK|AArch64 feature: BTI, PAC' <<<"$notes" || true)
  if [ "$objects" -eq 0 ] || [ "$marked" -ne "$objects" ]; then
    echo "control flow protection: $marked of $objects objects in $archive" >&2
    exit 1
  fi
elif [ "${1:-}" = "--no-cf" ]; then
  shift
  skip=(--nocfprotection)
fi
if [ "${1:-}" = "--probe-in" ]; then
  probe_in=("$2")
  shift 2
fi
hardening-check "${skip[@]}" "$@"
for elf in "$@" "${probe_in[@]}"; do
  # x86-64 probes each page with "orq $0x0,(%rsp)", aarch64 each 64 KiB with
  # "str xzr, [sp, #1024]", arm steps a page at a time down from sp in ip.
  # shellcheck disable=SC2016 # the $ is the assembler's, not the shell's
  if "$objdump" -d --no-show-raw-insn "$elf" |
    grep -E 'or[q]?[[:space:]]+\$0x0,\(%rsp\)|str[[:space:]]+xzr, \[sp, #1024\]|sub(\.w)?[[:space:]]+ip, ip, #4096' >/dev/null; then
    exit 0
  fi
done
echo "stack clash protection: no stack probe in $*" >&2
exit 1
