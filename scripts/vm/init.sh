#!/bin/sh
# shellcheck shell=dash
# /init of the VM test's guest (scripts/vm-test.sh puts it in the initramfs,
# with lib.sh and the rows under /usr/lib/vmtest). It brings up what a
# device's early boot has: the kernel's TPM driver, the disk that holds
# /quorvan and the EEPROM image, and the image at the EEPROM's sysfs path
# (this kernel has no I2C, so a tmpfs over /sys/bus carries the path). Then
# it runs the row that the kernel command line names, which runs the
# installed boot script as a device's init does and makes its checks:
#   vmtest_row=NAME             the row: rows/NAME.sh ("shell" gives a shell
#                               after the boot script)
#   vmtest_tcti=TCTI            provision: the transport kmm-host was built for
#   vmtest_cut=I vmtest_cuts=N  cut rows: cut the power at point I of N
#   vmtest_op=kmm|hash          cut rows: the operation to cut
#   vmtest_finished=1           cut rows: the host saw the previous boot's
#                               operation finish before the cut
# A boot through the firmware (the chain rows) starts a unified kernel image
# whose command line the firmware measures, the same for every row: the
# row's words come through QEMU's fw_cfg (opt/vmtest/env) instead, and the
# disk stands for the root file system. Before the row, the measured
# integration runs as initramfs-tools would run it (scripts/local-bottom/
# keymgr, which proves the boot over the root and reboots when keymgr
# fails); "vmtest: handed over" marks that it let the boot go on, and the
# row stands for the root file system's programs (vmtest_chain=1 tells it
# so). Its further words:
#   vmtest_tpm=none             tpm_tis is not loaded: no TPM at the boot run
#   vmtest_pcrN=HEX             PCR N's value in the policy of the release on
#                               the disk, as keymgr-mkpolicy printed it
# A boot that ends normally prints "vmtest: done" and powers off; a power cut
# reboots at once without syncing, so the page cache is lost. QEMU runs with
# -no-reboot: either way it exits.

/bin/busybox --install -s
export PATH=/usr/sbin:/usr/bin:/sbin:/bin
mount -t proc proc /proc
mount -t sysfs sysfs /sys
mount -t devtmpfs devtmpfs /dev
mount -t tmpfs tmpfs /tmp

vmtest=/usr/lib/vmtest
# shellcheck source=scripts/vm/lib.sh
. "$vmtest/lib.sh"

# wait_for PATH: up to 5 s for a device node to appear.
wait_for() {
  local n=0
  while [ ! -e "$1" ]; do
    n=$((n + 1))
    [ $n -le 500 ] || return 1
    usleep 10000
  done
}

# qemu_fw_cfg comes first in the load order: the words it brings may leave
# the TPM's driver out.
fw_env=/sys/firmware/qemu_fw_cfg/by_name/opt/vmtest/env/raw
while read -r module; do
  [ "$module" != tpm_tis ] || [ "${vmtest_tpm:-}" != none ] || continue
  insmod "/lib/modules/$module.ko" || bad "insmod $module"
  if [ "$module" = qemu_fw_cfg ] && [ -r "$fw_env" ]; then
    export vmtest_chain=1
    read -r words <"$fw_env" || [ -n "$words" ]
    for word in $words; do export "${word?}"; done
  fi
done </lib/modules/load-order
row=${vmtest_row:-none}
wait_for /dev/vda || bad "the disk /dev/vda appears"
if [ "${vmtest_tpm:-}" != none ]; then
  wait_for /dev/tpmrm0 || bad "the TPM's /dev/tpmrm0 appears"
  [ -e /dev/tpm0 ] || bad "the TPM's /dev/tpm0 appears"
fi
mkdir -p /disk /quorvan /eeprom
mount -t ext4 /dev/vda /disk || bad "the disk mounts"
mount --bind /disk/quorvan /quorvan
mkdir -p "$state"
# The devices folder is a tmpfs of links, as in sysfs; the row that has no
# EEPROM leaves the link out. The link's target is /eeprom in the
# initramfs and on the disk alike, so that it holds in a chroot into the
# disk too.
mount --bind /disk/eeprom /eeprom
mount -t tmpfs tmpfs /sys/bus
mkdir -p /sys/bus/i2c/devices
[ "$row" = no-eeprom ] || ln -s /eeprom /sys/bus/i2c/devices/0-0050

if [ -n "${vmtest_chain:-}" ]; then
  rootmnt=/disk sh /scripts/local-bottom/keymgr
  echo "vmtest: handed over"
fi

if [ -f "$vmtest/rows/$row.sh" ]; then
  sh "$vmtest/rows/$row.sh"
else
  bad "unknown row $row"
fi

echo "vmtest: done"
cd /
umount /quorvan /eeprom /disk 2>/dev/null || sync
poweroff -f
