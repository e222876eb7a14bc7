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
# device:/dev/tpmrm0, then again with a kmm-host built for device:/dev/tpm0,
# and a few with the verdict measured into PCR 14 and the key sealed to it.
# Then power cuts: the guest cuts its own power (sysrq b: no sync) part way
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
data_files=3000
started=$SECONDS

bash scripts/install-deps.sh qemu-system-arm cpio e2fsprogs
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
# The verdict measured into PCR 14 and the key sealed to it.
variant sealed "keymgr kmm-host" -DKEYMGR_MEASURE_PCR=14 -DKEYMGR_SEAL_TO_VERDICT=ON
# kmm-host for this machine on a swtpm socket: it lists the keys that each
# TPM state holds after the run, apart from the guest's own count.
host_sock=$build/run/host.sock
cmake -S . -B "$build/host-build" -G Ninja -DCMAKE_BUILD_TYPE=MinSizeRel -DBUILD_TESTING=OFF \
  -DKEYMGR_ROOT= -DKEYMGR_TCTI="swtpm:path=$host_sock" >/dev/null
cmake --build "$build/host-build" --target kmm-host -j 2
host_kmm=$(find "$build/host-build" -type f -name kmm-host -perm -u+x | head -n 1)

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
# libtss2-tcti-device0 is the transport that tctildr loads at run time.
wanted=("$kernel" busybox-static libtss2-tcti-device0)
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
  "$root"/{proc,sys,dev,tmp,disk,quorvan}
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
for module in virtio_mmio virtio_blk tpm_tis; do add_module "$module"; done

# Uncompressed: the guest unpacks it faster than it would decompress it.
(cd "$root" && find . | LC_ALL=C sort | cpio -o -H newc -R 0:0 --quiet) >"$build/initrd-tpmrm0"
# The tpm0 and sealed images: the same with their programs laid over it.
for name in tpm0 sealed; do
  (cd "$build/$name" && find . | LC_ALL=C sort | cpio -o -H newc -R 0:0 --quiet) >"$tmp/overlay"
  cat "$build/initrd-tpmrm0" "$tmp/overlay" >"$build/initrd-$name"
done

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

# boot NAME TPM_STATE DISK INITRD [VAR=VALUE...]: one boot, its checks
# counted. The guest sees the VARs in its environment.
boot() {
  local name=$1 state=$2 disk=$3 initrd=$4 log=$build/logs/$1.log sock=$build/run/swtpm.sock
  local status=0 swtpm_pid line t0=$SECONDS
  shift 4
  mkdir -p "$state"
  rm -f "$sock"
  swtpm socket --tpm2 --tpmstate dir="$state" --ctrl type=unixio,path="$sock" --terminate \
    --log file="$build/run/swtpm.log" 2>>"$build/run/swtpm.log" &
  swtpm_pid=$!
  pids=("$swtpm_pid")
  for _ in $(seq 100); do [ -S "$sock" ] && break; sleep 0.05; done
  timeout "$boot_timeout" qemu-system-aarch64 -M virt -cpu cortex-a57 -m 512 -nic none \
    -no-reboot -display none -monitor none -serial "file:$log" \
    -kernel "$vmlinuz" -initrd "$initrd" \
    -append "console=ttyAMA0 rdinit=/init panic=-1 quiet $*" \
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
  # How the boot ended: powered off after its checks, cut, or panicked.
  local want="vmtest: done"
  case "$*" in
    *vmtest_row=panic*) want="Kernel panic - not syncing: sysrq triggered crash" ;;
    *vmtest_op=*) want="vmtest: cutting the power" ;;
  esac
  if [ "$status" = 0 ] && grep -qF "$want" "$log"; then
    passed=$((passed + 1))
    echo "  ok   $name: ended ($want) in $((SECONDS - t0)) s"
  else
    failed=$((failed + 1))
    echo "  FAIL $name: did not end with \"$want\" (QEMU status $status); console in $log"
  fi
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

# after_series NAME DISK STATE: the disk is a clean file system and the TPM
# holds one key of this system.
after_series() {
  local keys count
  if e2fsck -n -f "$2" >"$build/logs/$1-e2fsck.log" 2>&1; then
    passed=$((passed + 1))
    echo "  ok   $1: e2fsck -n finds the disk clean"
  else
    failed=$((failed + 1))
    echo "  FAIL $1: e2fsck -n: see $build/logs/$1-e2fsck.log"
  fi
  if keys=$(host_keys "$3"); then
    count=$(grep -c . <<<"$keys" || true)
  else
    count="an unknown number of"
  fi
  if [ "$count" = 1 ]; then
    passed=$((passed + 1))
    echo "  ok   $1: the TPM holds 1 key of this system (kmm-host keys on the host)"
  else
    failed=$((failed + 1))
    echo "  FAIL $1: the TPM holds $count keys of this system (kmm-host keys on the host), expected 1"
  fi
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

echo "== The verdict measured into PCR 14 and the key sealed to it, on device:/dev/tpmrm0"
disk=$build/disk-sealed.img
state=$build/tpm-sealed
make_disk "$disk"
rm -rf "$state"
boot sealed-provision "$state" "$disk" "$build/initrd-sealed" vmtest_row=provision \
  vmtest_tcti=device:/dev/tpmrm0 vmtest_sealed=1
boot sealed-normal "$state" "$disk" "$build/initrd-sealed" vmtest_row=normal vmtest_sealed=1
boot sealed-file-altered "$state" "$disk" "$build/initrd-sealed" vmtest_row=file-altered \
  vmtest_sealed=1
boot sealed-after "$state" "$disk" "$build/initrd-sealed" vmtest_row=normal vmtest_sealed=1

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
