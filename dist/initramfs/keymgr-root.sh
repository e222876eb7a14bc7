# shellcheck shell=sh
# keymgr in the measured initramfs: the boot proof of a measured build runs
# from the initramfs that the boot chain measured, over the root file system
# before the system switches to it, so that nothing of the root file system
# has run by then. Sourced by the initramfs (initramfs-tools'
# scripts/local-bottom/keymgr, or a /init of one's own) after the root is
# mounted at ROOT:
#   keymgr_prove_root ROOT || halt
# It runs keymgr, then kmm-host 1 1: the first key proof of the boot, which
# closes the key for the rest of it (the separator). It fails, and the boot
# must not go on, when keymgr fails: its verdict could not be measured (no
# TPM, a missed deadline, a refused extend) or the files could not be read;
# a boot that went on would leave the verdict PCR for anyone to fill.
#
# The programs, their loader and their libraries are the initramfs's own
# (measured); the files they check, /proc, /sys and /dev are the root's as it
# will see them. So each runs chrooted into ROOT through the initramfs's
# loader, which the initramfs carries under /run/keymgr inside ROOT (a tmpfs
# over ROOT's /run, gone when the root's own /run is mounted).

# keymgr_in ROOT PROGRAM ARGS...: runs the initramfs's PROGRAM (a path) over
# ROOT.
keymgr_in() {
  _root=$1
  _program=$2
  shift 2
  _interp=$(cat /etc/keymgr/interp)
  _libs=$(cat /etc/keymgr/libs)
  chroot "$_root" "/run/keymgr$_interp" --library-path "$_libs" "/run/keymgr$_program" "$@"
}

keymgr_prove_root() {
  _root=$1
  for _dir in proc sys dev; do
    mount --rbind "/$_dir" "$_root/$_dir" || return 1
  done
  mount -t tmpfs -o mode=0755 keymgr "$_root/run" || return 1
  mkdir -p "$_root/run/keymgr" && mount --bind / "$_root/run/keymgr" || return 1
  _status=0
  keymgr_in "$_root" /usr/bin/keymgr || _status=$?
  if [ "$_status" -eq 0 ]; then
    keymgr_in "$_root" /usr/bin/kmm-host 1 1 || true
  fi
  umount "$_root/run/keymgr" "$_root/run"
  for _dir in dev sys proc; do
    umount -l "$_root/$_dir"
  done
  return "$_status"
}
