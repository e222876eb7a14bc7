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
#   vmtest_sealed=1             the build measures its verdict into PCR 14 and
#                               seals the key to it
#   vmtest_cut=I vmtest_cuts=N  cut rows: cut the power at point I of N
#   vmtest_op=kmm|hash          cut rows: the operation to cut
#   vmtest_finished=1           cut rows: the host saw the previous boot's
#                               operation finish before the cut
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
row=${vmtest_row:-none}

# wait_for PATH: up to 5 s for a device node to appear.
wait_for() {
  local n=0
  while [ ! -e "$1" ]; do
    n=$((n + 1))
    [ $n -le 500 ] || return 1
    usleep 10000
  done
}

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

if [ -f "$vmtest/rows/$row.sh" ]; then
  sh "$vmtest/rows/$row.sh"
else
  bad "unknown row $row"
fi

echo "vmtest: done"
cd /
umount /quorvan /disk 2>/dev/null || sync
poweroff -f
