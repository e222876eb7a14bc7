#!/usr/bin/env bash
# The device build on a real ARM kernel: the TPM through the kernel's driver,
# the installed boot script at boot, and power cuts.
#   scripts/vm-test.sh
# Boots Debian 12's arm64 cloud kernel under qemu-system-aarch64 (no KVM
# needed) with swtpm as the guest's TPM (tpm-tis-device, so the guest has
# /dev/tpm0 and /dev/tpmrm0), an initramfs of busybox and the aarch64 device
# build (scripts/package.sh --target aarch64), and an ext4 disk that keeps
# /quorvan and the EEPROM image across boots. The guest's /init
# (scripts/vm/init.sh) runs the row that the kernel command line names: its
# file in scripts/vm/rows runs the installed etc/init.d/keymgr-boot start as
# a device's init would, then its checks, with the helpers of
# scripts/vm/lib.sh, and reports them on the console. Rows: provisioning, a
# normal boot, a listed file altered, a key file altered, an unreadable
# EEPROM, a fresh TPM, a regeneration over the key, a kernel panic during the
# boot proof and the boot after it; all with the default transport
# device:/dev/tpmrm0, then again with a kmm-host built for device:/dev/tpm0.
# Then the chain of trust: a signed build that measures its verdict into
# PCR 14 and seals the key to the vendor's signed policy boots through
# firmware, U-Boot, which measures the unified kernel image it starts, and
# proves the key from the image's initramfs over the disk as the root file
# system; rows for a genuine chain, an initramfs that skips keymgr, another
# kernel, a new release, no TPM at the boot run, and what crosses the TPM's
# bus. Then power cuts: the guest cuts its own power (sysrq b: no sync) part way
# through kmm-host 3, and through keymgr hash over a few thousand files, at
# KEYMGR_VM_CUTS points each (20 by default); each next boot checks what the
# cut left. Last, e2fsck -n on the disks and the keys of this system in each
# TPM, listed by a kmm-host built for this machine.
# The kernel and busybox come from the machine's Debian sources through the
# same private apt state as the sysroot, cached by version in build-vm/debs.
# Each boot's console is kept in build-vm/logs.
set -euo pipefail
cd "$(dirname "$0")/.."

build="build-vm"
package="build-package-aarch64"
cuts=${KEYMGR_VM_CUTS:-20}
boot_timeout=60
# The kernel's command line, the same for every boot: the rows' words come
# after it, or through fw_cfg in a unified kernel image, which holds it.
cmdline="console=ttyAMA0 rdinit=/init panic=-1 quiet"
data_files=3000
started=$SECONDS

bash scripts/install-deps.sh vm
bash scripts/package.sh --target aarch64
mkdir -p "$build"
build=$(realpath "$build")
sysroot=$PWD/$package/sysroot

# --- Other builds of the device's programs ----------------------------------
# variant NAME TARGETS OPTIONS...: the device build's options and OPTIONS,
# its TARGETS stripped into $build/NAME/usr/bin, to lay over the image.
variant() {
  local name=$1 targets=$2 target
  shift 2
  cmake -S . -B "$build/$name-build" -G Ninja -DCMAKE_BUILD_TYPE=MinSizeRel -DBUILD_TESTING=OFF \
    -DKEYMGR_ROOT= -DKEYMGR_REDACT_OOK=ON -DCMAKE_INSTALL_PREFIX=/usr \
    --toolchain cmake/toolchains/aarch64-linux-gnu.cmake -DKEYMGR_SYSROOT="$sysroot" "$@" >/dev/null
  # shellcheck disable=SC2086 # one word per target
  cmake --build "$build/$name-build" --target $targets -j 2
  rm -rf "${build:?}/$name"
  mkdir -p "$build/$name/usr/bin"
  for target in $targets; do
    aarch64-linux-gnu-strip -o "$build/$name/usr/bin/$target" \
      "$(find "$build/$name-build" -type f -name "$target" -perm -u+x | head -n 1)"
  done
}
# kmm-host for device:/dev/tpm0: only kmm-host holds the module.
variant tpm0 kmm-host -DKEYMGR_TCTI=device:/dev/tpm0
# The chain's build: signed with the test digest key, its verdict measured
# into PCR 14, the key sealed to the test vendor key's policies. It shows
# the one-off key on the console, for the check that it never crosses the
# TPM's bus.
digest_key=tests/cli/data/digest_key
vendor_key=tests/policy/data/vendor_key
variant sealed "keymgr kmm-host" -DKEYMGR_MEASURE_PCR=14 -DKEYMGR_SEAL_TO_VERDICT=ON \
  -DKEYMGR_DIGEST_PUBKEY="$PWD/$digest_key.pub.pem" \
  -DKEYMGR_POLICY_PUBKEY="$PWD/$vendor_key.pub.pem" -DKEYMGR_REDACT_OOK=OFF
# The tools for this machine: kmm-host on a swtpm socket lists the keys that
# each TPM state holds after the run, apart from the guest's own count;
# keymgr-mkdigest and keymgr-mkpolicy make the chain's signed files as a
# build host does.
host_sock=$build/run/host.sock
cmake -S . -B "$build/host-build" -G Ninja -DCMAKE_BUILD_TYPE=MinSizeRel -DBUILD_TESTING=OFF \
  -DKEYMGR_ROOT= -DKEYMGR_TCTI="swtpm:path=$host_sock" >/dev/null
cmake --build "$build/host-build" --target kmm-host keymgr-mkdigest keymgr-mkpolicy -j 2
host_tool() { find "$build/host-build" -type f -name "$1" -perm -u+x | head -n 1; }
host_kmm=$(host_tool kmm-host)
mkdigest=$(host_tool keymgr-mkdigest)
mkpolicy=$(host_tool keymgr-mkpolicy)

# --- Kernel and busybox -----------------------------------------------------
tmp=$(mktemp -d)
pids=()
cleanup() {
  local pid
  for pid in "${pids[@]}"; do kill "$pid" 2>/dev/null || true; done
  rm -rf "$tmp"
}
trap cleanup EXIT
trap 'exit 1' INT TERM

# shellcheck source=scripts/target-apt.sh
. scripts/target-apt.sh
target_apt arm64 "$tmp/apt"
# The generic arm64 kernel has no tpm_tis; the cloud one has. The meta
# package names the versioned one.
kernel=$(apt-cache depends --important linux-image-cloud-arm64 |
  awk '$1 == "Depends:" && $2 ~ /^linux-image-/ { print $2; exit }')
[ -n "$kernel" ] || { echo "no linux-image-cloud-arm64 in the arm64 package lists" >&2; exit 1; }
# libtss2-tcti-device0 is the transport that tctildr loads at run time;
# systemd-boot-efi holds the EFI stub of the chain's unified kernel images.
wanted=("$kernel" busybox-static libtss2-tcti-device0 systemd-boot-efi)
mkdir -p "$build/debs"
debs=()
for name in $(apt-get download --print-uris "${wanted[@]}" | cut -d" " -f2); do
  debs+=("$name")
  [ -f "$build/debs/$name" ] || fetch=1
done
if [ -n "${fetch:-}" ]; then
  echo "Downloading ${wanted[*]} (arm64)"
  (cd "$build/debs" && apt-get download -q "${wanted[@]}" >/dev/null)
fi
for name in "$build"/debs/*.deb; do
  [[ " ${debs[*]} " == *" ${name##*/} "* ]] || rm -f "$name"
done
echo "Kernel: $kernel; $(printf '%s ' "${debs[@]}")"
rm -rf "$build/target"
for name in "${debs[@]}"; do dpkg-deb -x "$build/debs/$name" "$build/target"; done
vmlinuz=$(ls "$build"/target/boot/vmlinuz-*)
moddir=$(ls -d "$build"/target/lib/modules/*)

# --- Initramfs --------------------------------------------------------------
root=$build/initramfs
rm -rf "$root"
mkdir -p "$root"/{bin,sbin,usr/bin,usr/sbin,usr/lib/aarch64-linux-gnu,usr/lib/modules} \
  "$root"/{proc,sys,dev,tmp,disk,quorvan,eeprom}
ln -s usr/lib "$root/lib"
cp "$build/target/bin/busybox" "$root/bin/"
ln -s busybox "$root/bin/sh"
cp -a "$package/install/." "$root/"
install -m 755 scripts/vm/init.sh "$root/init"
mkdir -p "$root/usr/lib/vmtest"
cp -r scripts/vm/lib.sh scripts/vm/rows "$root/usr/lib/vmtest/"

# add_library SONAME: the library from the sysroot (or the unpacked
# packages), and what it needs, under usr/lib/aarch64-linux-gnu.
add_library() {
  local dir found="" need
  [ ! -e "$root/usr/lib/aarch64-linux-gnu/$1" ] || return 0
  for dir in "$sysroot"/{lib,usr/lib}/aarch64-linux-gnu "$build"/target/usr/lib/aarch64-linux-gnu; do
    if [ -e "$dir/$1" ]; then found=$dir/$1; break; fi
  done
  [ -n "$found" ] || { echo "library $1 not found" >&2; exit 1; }
  cp -L "$found" "$root/usr/lib/aarch64-linux-gnu/$1"
  for need in $(needed "$found"); do add_library "$need"; done
}
needed() { readelf -d "$1" | sed -n 's/.*(NEEDED).*\[\(.*\)\]/\1/p'; }
for program in "$root"/usr/bin/* "$build"/{tpm0,sealed}/usr/bin/*; do
  for need in $(needed "$program"); do add_library "$need"; done
done
add_library libtss2-tcti-device.so.0
# The programs' loader is /lib/ld-linux-aarch64.so.1.
ln -s aarch64-linux-gnu/ld-linux-aarch64.so.1 "$root/usr/lib/ld-linux-aarch64.so.1"

# add_module NAME: the module and, first, those its depends= field names
# (the package has no modules.dep).
add_module() {
  local file dep
  [ ! -e "$root/usr/lib/modules/$1.ko" ] || return 0
  file=$(find "$moddir" \( -name "$1.ko" -o -name "${1//_/-}.ko" \) -print -quit)
  [ -n "$file" ] || { echo "module $1 not found" >&2; exit 1; }
  for dep in $(tr '\0' '\n' <"$file" | sed -n 's/^depends=//p' | head -n 1 | tr ',' ' '); do
    add_module "$dep"
  done
  cp "$file" "$root/usr/lib/modules/$1.ko"
  echo "$1" >>"$root/usr/lib/modules/load-order"
}
# qemu_fw_cfg first: /init reads the chain rows' words through it.
for module in qemu_fw_cfg virtio_mmio virtio_blk tpm_tis; do add_module "$module"; done

# cpio_of DIR: an initramfs of DIR's files, on standard output.
# Uncompressed: the guest unpacks it faster than it would decompress it.
cpio_of() { (cd "$1" && find . | LC_ALL=C sort | cpio -o -H newc -R 0:0 --quiet); }
cpio_of "$root" >"$build/initrd-tpmrm0"
# The tpm0 image: the same with its kmm-host laid over it.
cpio_of "$build/tpm0" >"$tmp/overlay"
cat "$build/initrd-tpmrm0" "$tmp/overlay" >"$build/initrd-tpm0"

# The chain's images: the sealed build's programs laid over it, with the
# measured integration where initramfs-tools and its keymgr hook put it:
# scripts/local-bottom/keymgr, keymgr-root.sh, and the programs' loader and
# library folders as the hook writes them (for the chroot into the root,
# through /run/keymgr). /scripts/functions stands in for initramfs-tools'
# own, with the one function the script uses.
sealed=$build/sealed
mkdir -p "$sealed"/{scripts/local-bottom,usr/share/keymgr,etc/keymgr}
install -m 755 dist/initramfs/scripts/local-bottom/keymgr "$sealed/scripts/local-bottom/keymgr"
install -m 644 dist/initramfs/keymgr-root.sh "$sealed/usr/share/keymgr/"
echo 'log_failure_msg() { echo "Failure: $*"; }' >"$sealed/scripts/functions"
readelf -l "$sealed/usr/bin/keymgr" | sed -n 's/.*interpreter: \(.*\)]/\1/p' \
  >"$sealed/etc/keymgr/interp"
libs=""
for dir in "$root"/{lib,usr/lib} "$root"/lib/*-linux-gnu* "$root"/usr/lib/*-linux-gnu*; do
  [ -d "$dir" ] && libs="$libs${libs:+:}/run/keymgr${dir#"$root"}"
done
echo "$libs" >"$sealed/etc/keymgr/libs"
cpio_of "$sealed" >"$tmp/overlay"
cat "$build/initrd-tpmrm0" "$tmp/overlay" >"$build/initrd-chain"
# The attacker's: keymgr skipped, the good verdict extended by hand.
rm -rf "$build/chain-skip"
mkdir -p "$build/chain-skip/scripts/local-bottom"
install -m 755 scripts/vm/skip-keymgr.sh "$build/chain-skip/scripts/local-bottom/keymgr"
cpio_of "$build/chain-skip" >"$tmp/overlay"
cat "$build/initrd-chain" "$tmp/overlay" >"$build/initrd-chain-skip"
# Release 2's: one file more.
rm -rf "$build/chain-release"
mkdir -p "$build/chain-release/etc"
echo "release 2" >"$build/chain-release/etc/vmtest-release"
cpio_of "$build/chain-release" >"$tmp/overlay"
cat "$build/initrd-chain" "$tmp/overlay" >"$build/initrd-chain-release"

# --- Disks ------------------------------------------------------------------
# make_disk IMAGE: an ext4 image with /quorvan (the protected files and a few
# thousand data files for the hash cuts), a folder for the EEPROM image, and
# the test's own folder with the manifest of the rows.
make_disk() {
  local files=$tmp/disk i pad
  rm -rf "$files"
  mkdir -p "$files"/quorvan/{hidden,spool/log,protected,data} "$files"/eeprom "$files"/vmtest
  printf 'hostname=vm-device\n' >"$files/quorvan/protected/device.conf"
  head -c 65536 /dev/urandom >"$files/quorvan/protected/firmware.bin"
  echo "round 0" >"$files/quorvan/protected/generation"
  pad=$(printf '%0900d' 0)
  for ((i = 0; i < data_files; i++)); do
    printf 'data file %05d\n%s\n' "$i" "$pad" >"$(printf '%s/quorvan/data/%05d' "$files" "$i")"
  done
  printf '%s\n' /usr/bin/keymgr /usr/bin/kmm-host /usr/bin/keymgr-eeprom /etc/init.d/keymgr-boot \
    /quorvan/protected/device.conf /quorvan/protected/firmware.bin >"$files/vmtest/manifest"
  rm -f "$1"
  mke2fs -q -t ext4 -b 4096 -N 8192 -E root_owner=0:0 -d "$files" "$1" 64M
}

# --- Boots ------------------------------------------------------------------
passed=0
failed=0
disk_options=""
mkdir -p "$build/logs" "$build/run"
rm -f "$build"/logs/*.log
: >"$build/run/swtpm.log"

# boot NAME TPM_STATE DISK IMAGE [VAR=VALUE...]: one boot, its checks
# counted. IMAGE is an initramfs that QEMU starts with the kernel, the VARs
# on the kernel command line; or an ESP (*.esp) that U-Boot starts the
# unified kernel image from, the VARs through fw_cfg (the image's command
# line is measured). The guest sees the VARs in its environment. With
# bus_log set to a file, swtpm logs there every byte it receives and sends.
boot() {
  local name=$1 state=$2 disk=$3 image=$4 log=$build/logs/$1.log sock=$build/run/swtpm.sock
  local status=0 swtpm_pid line t0=$SECONDS machine tpm_log=file=$build/run/swtpm.log
  shift 4
  if [[ $image == *.esp ]]; then
    # The ESP is U-Boot's virtio 1: QEMU gives the last virtio-blk-device
    # the first transport, which the kernel names vda, and that is the disk.
    # shellcheck disable=SC2054 # QEMU's options hold commas
    machine=(-bios "$firmware" -drive if=pflash,unit=1,format=raw,file="$uboot_env"
      -drive file="$image",format=raw,if=none,id=esp -device virtio-blk-device,drive=esp
      -fw_cfg name=opt/vmtest/env,string="$*")
  else
    machine=(-kernel "$vmlinuz" -initrd "$image" -append "$cmdline $*")
  fi
  [ -z "${bus_log:-}" ] || tpm_log=file=$bus_log,level=20
  mkdir -p "$state"
  rm -f "$sock"
  swtpm socket --tpm2 --tpmstate dir="$state" --ctrl type=unixio,path="$sock" --terminate \
    --log "$tpm_log" 2>>"$build/run/swtpm.log" &
  swtpm_pid=$!
  pids=("$swtpm_pid")
  for _ in $(seq 100); do [ -S "$sock" ] && break; sleep 0.05; done
  timeout "$boot_timeout" qemu-system-aarch64 -M virt -cpu cortex-a57 -m 512 -nic none \
    -no-reboot -display none -monitor none -serial "file:$log" "${machine[@]}" \
    -chardev socket,id=chrtpm,path="$sock" -tpmdev emulator,id=tpm0,chardev=chrtpm \
    -device tpm-tis-device,tpmdev=tpm0 \
    -drive file="$disk",format=raw,if=none,id=disk"$disk_options" -device virtio-blk-device,drive=disk &
  pids+=($!)
  wait $! || status=$?
  # swtpm ends when QEMU closes its connection.
  for _ in $(seq 50); do kill -0 "$swtpm_pid" 2>/dev/null || break; sleep 0.1; done
  kill "$swtpm_pid" 2>/dev/null || true
  wait "$swtpm_pid" 2>/dev/null || true
  pids=()
  [ -f "$log" ] || : >"$log"
  sed -i 's/\r$//' "$log"
  while IFS= read -r line; do
    case "$line" in
      "vmtest: ok "*) passed=$((passed + 1)); echo "  ok   $name: ${line#vmtest: ok }" ;;
      "vmtest: FAIL "*) failed=$((failed + 1)); echo "  FAIL $name: ${line#vmtest: FAIL }" ;;
      "vmtest: "*) echo "       $name: ${line#vmtest: }" ;;
    esac
  done <"$log"
  # How the boot ended: powered off after its checks, cut, panicked, or
  # stopped by the measured integration.
  local want="vmtest: done"
  case "$*" in
    *vmtest_row=panic*) want="Kernel panic - not syncing: sysrq triggered crash" ;;
    *vmtest_op=*) want="vmtest: cutting the power" ;;
    *vmtest_tpm=none*) want="keymgr: the boot could not be measured; the root is not handed over" ;;
  esac
  local ended=1
  [ "$status" = 0 ] && grep -qF "$want" "$log" && ended=0
  counted "$ended" "$name: ended ($want) in $((SECONDS - t0)) s" \
    "$name: did not end with \"$want\" (QEMU status $status); console in $log"
}

# counted STATUS OK_TEXT FAIL_TEXT: a check of the host's, passed when
# STATUS is 0, counted as the guest's are.
counted() {
  if [ "$1" = 0 ]; then
    passed=$((passed + 1))
    echo "  ok   $2"
  else
    failed=$((failed + 1))
    echo "  FAIL $3"
  fi
}

# host_check WHAT COMMAND...: a check of the host's, passed when COMMAND
# succeeds.
host_check() {
  local what=$1 status=0
  shift
  "$@" || status=$?
  counted "$status" "$what" "$what"
}

# host_keys STATE: the keys of this system in a powered-off TPM's state, as
# the host's kmm-host lists them, one a line.
host_keys() {
  local pid status=0
  rm -f "$host_sock" "$host_sock.ctrl"
  swtpm socket --tpm2 --tpmstate dir="$1" --server type=unixio,path="$host_sock" \
    --ctrl type=unixio,path="$host_sock.ctrl" --flags not-need-init,startup-clear \
    --log file="$build/run/swtpm.log" 2>>"$build/run/swtpm.log" &
  pid=$!
  pids=("$pid")
  for _ in $(seq 100); do [ -S "$host_sock" ] && break; sleep 0.05; done
  "$host_kmm" keys || status=$?
  kill "$pid" 2>/dev/null || true
  wait "$pid" 2>/dev/null || true
  pids=()
  return "$status"
}

# disk_clean NAME DISK: the disk is a clean file system.
disk_clean() {
  local status=0
  e2fsck -n -f "$2" >"$build/logs/$1-e2fsck.log" 2>&1 || status=$?
  counted "$status" "$1: e2fsck -n finds the disk clean" \
    "$1: e2fsck -n: see $build/logs/$1-e2fsck.log"
}

# after_series NAME DISK STATE: the disk is a clean file system and the TPM
# holds one key of this system.
after_series() {
  local keys count status
  disk_clean "$1" "$2"
  if keys=$(host_keys "$3"); then
    count=$(grep -c . <<<"$keys" || true)
  else
    count="an unknown number of"
  fi
  status=0
  [ "$count" = 1 ] || status=1
  counted "$status" "$1: the TPM holds 1 key of this system (kmm-host keys on the host)" \
    "$1: the TPM holds $count keys of this system (kmm-host keys on the host), expected 1"
}

# rows TRANSPORT INITRD: the rows on a new disk and a new TPM.
rows() {
  local t=$1 initrd=$2 disk=$build/disk-$1.img state=$build/tpm-$1
  echo "== Rows with kmm-host on device:/dev/$t"
  make_disk "$disk"
  rm -rf "$state" "$build/tpm-fresh"
  boot "$t-provision" "$state" "$disk" "$initrd" vmtest_row=provision vmtest_tcti=device:/dev/"$t"
  boot "$t-normal" "$state" "$disk" "$initrd" vmtest_row=normal
  boot "$t-file-altered" "$state" "$disk" "$initrd" vmtest_row=file-altered
  boot "$t-key-altered" "$state" "$disk" "$initrd" vmtest_row=key-altered
  boot "$t-no-eeprom" "$state" "$disk" "$initrd" vmtest_row=no-eeprom
  boot "$t-fresh-tpm" "$build/tpm-fresh" "$disk" "$initrd" vmtest_row=fresh-tpm
  boot "$t-regenerate" "$state" "$disk" "$initrd" vmtest_row=regenerate
  boot "$t-panic" "$state" "$disk" "$initrd" vmtest_row=panic
  boot "$t-after-panic" "$state" "$disk" "$initrd" vmtest_row=after-panic
}

rows tpmrm0 "$build/initrd-tpmrm0"
rows tpm0 "$build/initrd-tpm0"
after_series tpm0 "$build/disk-tpm0.img" "$build/tpm-tpm0"

# --- The chain of trust -----------------------------------------------------
echo "== The chain of trust: the sealed build booted through U-Boot, on device:/dev/tpmrm0"
chain_started=$SECONDS
firmware=/usr/lib/u-boot/qemu_arm64/u-boot.bin
stub=$build/target/usr/lib/systemd/boot/efi/linuxaa64.efi.stub
# U-Boot's environment, stored in its flash (the second pflash bank): no
# delay, the ESP's image loaded and started, and a reset (QEMU exits) when
# that fails, rather than a prompt. It replaces the built-in one whole.
uboot_env=$build/uboot-env.img
{
  echo "bootdelay=0"
  # shellcheck disable=SC2016 # U-Boot expands ${fdtcontroladdr}
  echo 'bootcmd=virtio scan; if load virtio 1:1 0x40400000 EFI/BOOT/BOOTAA64.EFI; then' \
    'bootefi 0x40400000 ${fdtcontroladdr}; fi; reset'
} >"$tmp/uboot-env.txt"
mkenvimage -s 0x40000 -o "$uboot_env" "$tmp/uboot-env.txt"
truncate -s 64M "$uboot_env"

# make_image NAME KERNEL INITRD: the unified kernel image $build/NAME.efi
# (systemd's arm64 EFI stub with the os-release, the command line, the
# initramfs and the kernel, each a section at the next 64 KiB boundary after
# the one before) and $build/NAME.esp, a GPT disk whose FAT partition holds
# it where U-Boot looks for it.
make_image() {
  local uki=$build/$1.efi esp=$build/$1.esp vma=0 size start pair section file mib
  local sections=()
  printf %s "$cmdline" >"$tmp/cmdline"
  printf 'ID=keymgr-vm\nNAME="keymgr VM test"\n' >"$tmp/osrel"
  while read -r size start; do
    ((0x$start + 0x$size <= vma)) || vma=$((0x$start + 0x$size))
  done < <(aarch64-linux-gnu-objdump -h "$stub" | awk '$2 ~ /^\./ { print $3, $4 }')
  for pair in .osrel:"$tmp/osrel" .cmdline:"$tmp/cmdline" .initrd:"$3" .linux:"$2"; do
    section=${pair%%:*} file=${pair#*:}
    vma=$(((vma + 0xffff) & ~0xffff))
    sections+=(--add-section "$section=$file"
      --change-section-vma "$(printf '%s=0x%x' "$section" "$vma")")
    vma=$((vma + $(stat -c %s "$file")))
  done
  aarch64-linux-gnu-objcopy "${sections[@]}" "$stub" "$uki"
  mib=$(($(stat -c %s "$uki") / 1048576 + 8))
  rm -f "$esp"
  truncate -s $((mib + 2))M "$esp"
  printf 'label: gpt\nstart=2048, size=%d, type=C12A7328-F81F-11D2-BA4B-00A0C93EC93B\n' \
    $((mib * 2048)) | sfdisk -q "$esp"
  mkfs.vfat -F 32 -n ESP --offset 2048 "$esp" $((mib * 1024)) >/dev/null 2>&1
  mmd -i "$esp@@1M" ::/EFI ::/EFI/BOOT
  mcopy -i "$esp@@1M" "$uki" ::/EFI/BOOT/BOOTAA64.EFI
}
# The genuine image of release 1; the attacker's; the genuine initramfs with
# Debian's kernel changed by one byte, the L of the banner it logs as it
# starts ("Linux version ...": of the two copies in the image, the last is
# the one the kernel uses); and release 2's.
make_image chain-a "$vmlinuz" "$build/initrd-chain"
make_image chain-skip "$vmlinuz" "$build/initrd-chain-skip"
banner=$(grep -obUa "Linux version " "$vmlinuz" | tail -n 1 | cut -d: -f1)
cp "$vmlinuz" "$build/vmlinuz-changed"
printf l | dd of="$build/vmlinuz-changed" bs=1 seek="$banner" conv=notrunc 2>/dev/null
make_image chain-kernel "$build/vmlinuz-changed" "$build/initrd-chain"
make_image chain-release "$vmlinuz" "$build/initrd-chain-release"

# sign_release NAME RELEASE FILE: the vendor's policy for the image NAME as
# release RELEASE, in FILE, as the build host signs it; the PCR values it
# binds, as keymgr-mkpolicy prints them, in $build/NAME.pcrs.
sign_release() {
  "$mkpolicy" --key "$vendor_key.pem" --release "$2" --verdict-pcr 14 --uki "$build/$1.efi" \
    --output "$3" >"$build/$1.pcrs"
}

# make_chain_disk IMAGE: the root file system of the chain rows: the
# folders that the chroot into it needs, the files its manifest lists, and
# release 1 for the image chain-a, made on the tree before the file system
# is, as a build host makes it: the digest file and keymgr.sig
# (keymgr-mkdigest) and the vendor's policy (keymgr-mkpolicy). Release 2's
# keymgr.sig and policy go to $build/release-2.*; the test keeps release 1's
# keymgr.sig in /vmtest too.
make_chain_disk() {
  local files=$tmp/chain-root
  rm -rf "$files"
  mkdir -p "$files"/{proc,sys,dev,run,eeprom,etc,vmtest} \
    "$files"/quorvan/{hidden,spool/log,protected}
  echo vm-device >"$files/etc/hostname"
  printf 'hostname=vm-device\n' >"$files/quorvan/protected/device.conf"
  head -c 65536 /dev/urandom >"$files/quorvan/protected/firmware.bin"
  printf '%s\n' /etc/hostname /quorvan/protected/device.conf /quorvan/protected/firmware.bin \
    >"$files/quorvan/hidden/keymgr.list"
  "$mkdigest" --root "$files" --key "$digest_key.pem" --counter 2
  cp "$files/quorvan/hidden/keymgr.sig" "$build/release-2.sig"
  "$mkdigest" --root "$files" --key "$digest_key.pem" --counter 1
  cp "$files/quorvan/hidden/keymgr.sig" "$files/vmtest/release-1.sig"
  sign_release chain-a 1 "$files/quorvan/hidden/keymgr.policy"
  sign_release chain-release 2 "$build/release-2.policy"
  rm -f "$1"
  mke2fs -q -t ext4 -b 4096 -E root_owner=0:0 -d "$files" "$1" 32M
}

# disk_file PATH: a file of the chain's disk, as a mount would show it (the
# journal replayed on a copy; the image stays as it was).
disk_file() {
  cp --sparse=always "$chain_disk" "$tmp/disk-copy"
  e2fsck -E journal_only -p "$tmp/disk-copy" >/dev/null 2>&1 || true
  debugfs -R "cat $1" "$tmp/disk-copy" 2>/dev/null
  rm -f "$tmp/disk-copy"
}

# absent PATTERN FILE: no line of FILE holds PATTERN, whatever its case.
absent() { ! grep -qi -- "$1" "$2"; }

# chain_boot NAME ROW IMAGE POLICY [VAR=VALUE...]: a boot of the chain's
# disk and TPM through U-Boot from IMAGE's ESP, running ROW; the guest is
# told the PCR values that the policy for the image POLICY binds (the
# release on the disk).
chain_boot() {
  local name=$1 row=$2 image=$3 words
  mapfile -t words < <(sed -n 's/^PCR \([0-9]*\) = \([0-9a-f]*\)$/vmtest_pcr\1=\2/p' \
    "$build/$4.pcrs")
  shift 4
  boot "$name" "$chain_state" "$chain_disk" "$build/$image.esp" vmtest_row="$row" "${words[@]}" "$@"
}

# check_bus: the bytes that crossed the TPM's bus in the genuine chain's
# boot, as swtpm logged them, hold the extend of the good verdict, but not
# the one-off key that the boot's proof unsealed (the console shows it), nor
# the key's password (keymgr.hddpwd), nor its auth value in the TPM (the MD5
# of the password's hex text).
check_bus() {
  local bus=$build/logs/chain-genuine.bus good ook password auth
  # One message a line in hex: the log shows each in lines of 16 bytes.
  awk '/^( [0-9A-F][0-9A-F])+ *$/ { gsub(/ /, ""); message = message $0; next }
       message != "" { print message; message = "" }
       END { if (message != "") print message }' "$build/logs/chain-genuine.swtpm.log" >"$bus"
  good=$(printf 'keymgr boot verdict: BN=OK' | sha256sum | cut -c1-64)
  host_check "bus: $(wc -l <"$bus") messages captured, the good verdict's extend among them" \
    grep -qi "$good" "$bus"
  ook=$(sed -n 's/.*one_off_key: print_array: size\[32\] \([0-9A-F ]*\)$/\1/p' \
    "$build/logs/chain-genuine.log" | head -n 1 | tr -d ' ')
  host_check "bus: the console shows the one-off key that the proof unsealed (${ook:0:8}...)" \
    [ ${#ook} = 64 ]
  host_check "bus: the one-off key never crosses it" absent "$ook" "$bus"
  password=$(disk_file /quorvan/hidden/keymgr.hddpwd | od -An -tx1 -v | tr -d ' \n' | tr a-f A-F)
  auth=$(printf %s "$password" | md5sum | cut -c1-32)
  host_check "bus: the key's password (${#password} hex digits) never crosses it" \
    absent "${password:-none read}" "$bus"
  host_check "bus: the key's auth value (${auth:0:8}...) never crosses it" absent "$auth" "$bus"
}

chain_disk=$build/disk-chain.img
chain_state=$build/tpm-chain
make_chain_disk "$chain_disk"
# Only the SHA-256 bank: the firmware hashes what it measures once for each
# bank, in emulated code.
rm -rf "$chain_state"
mkdir -p "$chain_state"
swtpm_setup --tpm2 --tpmstate "$chain_state" --pcr-banks sha256 >/dev/null
chain_boot chain-provision chain-provision chain-a chain-a
bus_log=$build/logs/chain-genuine.swtpm.log chain_boot chain-genuine chain-genuine chain-a chain-a
check_bus
chain_boot chain-skip chain-skip chain-skip chain-a
chain_boot chain-kernel chain-kernel chain-kernel chain-a
# The update: release 2's keymgr.sig and policy in place of release 1's.
e2fsck -E journal_only -p "$chain_disk" >/dev/null || [ $? = 1 ]
for name in sig policy; do
  printf 'rm /quorvan/hidden/keymgr.%s\nwrite %s /quorvan/hidden/keymgr.%s\n' \
    "$name" "$build/release-2.$name" "$name"
done | debugfs -w -f - "$chain_disk" >/dev/null 2>&1
chain_boot chain-release chain-release chain-release chain-release
chain_boot chain-no-tpm chain-no-tpm chain-release chain-release vmtest_tpm=none
host_check "chain-no-tpm: not handed over to the root" \
  absent "^vmtest: handed over" "$build/logs/chain-no-tpm.log"
status_log=$(disk_file /quorvan/spool/log/keymgr.log | paste -sd' ')
host_check "chain-no-tpm: the status log is ${status_log:-empty}: keymgr ran, no proof followed" \
  [ "$status_log" = BN=OK ]
host_check "chain-no-tpm: the event log is empty: no event is claimed" \
  [ -z "$(disk_file /quorvan/spool/log/keymgr.events)" ]
# The TPM back: the genuine chain of release 2 proves as before.
chain_boot chain-after chain-genuine chain-release chain-release
# The host's kmm-host knows no key sealed to the vendor's policy: the
# guest's counted them.
disk_clean chain "$chain_disk"
echo "  (the chain rows: $((SECONDS - chain_started)) s)"

echo "== Power cuts, $cuts points through kmm-host 3 and through keymgr hash"
disk=$build/disk-tpmrm0.img
state=$build/tpm-tpmrm0
# The host's disk takes a write in microseconds, a device's flash in
# milliseconds: at 100 writes a second the operations' writes take their
# share of the time, as on a device, and the cut points fall between them
# too, not only into the TPM's work.
disk_options=,throttling.iops-write=100
# A cut that came after the operation had finished (its console says so)
# must leave all of it in place: the next boot is told.
finished=()
for op in kmm hash; do
  for ((i = 1; i <= cuts; i++)); do
    boot "cut-$op-$i" "$state" "$disk" "$build/initrd-tpmrm0" vmtest_row=cut \
      vmtest_op=$op vmtest_cut=$i vmtest_cuts="$cuts" "${finished[@]}"
    finished=()
    if grep -q "^vmtest: finished before the cut" "$build/logs/cut-$op-$i.log"; then
      finished=(vmtest_finished=1)
    fi
  done
done
boot "cut-last" "$state" "$disk" "$build/initrd-tpmrm0" vmtest_row=cut "${finished[@]}"
after_series tpmrm0 "$disk" "$state"

echo "== What the cuts left"
# left OP: how many cuts of OP left each outcome.
left() {
  sed -n "s/^vmtest: cut-left $1 //p" "$build"/logs/cut-*.log | sort | uniq -c |
    awk '{ n = $1; $1 = ""; printf "%s%d x%s", sep, n, $0; sep = ", " }'
}
echo "  kmm-host 3 (N new, O old, in the order written: SC digest in EEPROM, keymgr.cs,"
echo "    keymgr.hddkeyid, keymgr.hddpwd, keymgr.ook, store key in EEPROM): $(left kmm)"
echo "  keymgr hash (the digest file keymgr.cb): $(left hash)"
echo "VM test: $((SECONDS - started)) s"
echo "$passed passed, $failed failed"
[ "$failed" = 0 ]
