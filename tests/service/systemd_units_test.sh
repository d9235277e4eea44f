#!/usr/bin/env bash
# Boots this machine's own userspace in a container (systemd-nspawn, systemd
# as PID 1) over an overlay that holds an install of the build, then checks
# the units as shipped: systemd-analyze verify, socket activation, the
# confinement the running helper really has, every command through vitdctl
# and the example client, failures at error priority in the journal, quit and
# restart through the socket, and finally a reboot of the container.
#
#   systemd_units_test.sh BUILD_DIR            the build, as cmake --install lays it out
#   systemd_units_test.sh BUILD_DIR DEB...     the Debian packages instead, installed
#                                              with dpkg
# Either way the example client is built in the container through pkg-config.
set -uo pipefail
build=${1:?usage: systemd_units_test.sh BUILD_DIR [DEB...]}
shift
debs=("$@")
here=$(cd "$(dirname "$0")" && pwd)

skip() { echo "SKIP: $*"; exit 77; }
[ "$(id -u)" -eq 0 ] || skip "needs root (overlay mount, systemd-nspawn)"
command -v systemd-nspawn >/dev/null || skip "systemd-nspawn is missing (package systemd-container)"
[ -x /lib/systemd/systemd ] || skip "systemd is not installed"
grep -qw overlay /proc/filesystems || modprobe overlay 2>/dev/null || skip "no overlayfs"
[ -x "$build/bin/vitd_helper" ] || skip "$build/bin/vitd_helper is not built"

work=$(mktemp -d /tmp/vitd-units.XXXXXX)
nspawn_pid=
cleanup() {
  if [ -n "$nspawn_pid" ] && kill -0 "$nspawn_pid" 2>/dev/null; then
    kill -TERM "$nspawn_pid" 2>/dev/null
    for _ in $(seq 50); do kill -0 "$nspawn_pid" 2>/dev/null || break; sleep 0.1; done
    kill -KILL "$nspawn_pid" 2>/dev/null
  fi
  umount -l "$work/root/private/var" 2>/dev/null
  umount -l "$work/root" 2>/dev/null
  if [ -n "${disk:-}" ]; then partx -d "$disk" 2>/dev/null; losetup -d "$disk" 2>/dev/null; fi
  rm -rf "$work"
}
trap cleanup EXIT

mkdir -p "$work"/{upper,overlay-work,root}
if [ ${#debs[@]} -eq 0 ]; then
  # The install, as `cmake --install` makes it, in the overlay's upper layer.
  DESTDIR="$work/upper" cmake --install "$build" >/dev/null || { echo "FAIL: cmake --install"; exit 1; }
fi
mount -t overlay overlay -o "lowerdir=/,upperdir=$work/upper,workdir=$work/overlay-work" "$work/root" ||
  skip "cannot mount an overlay of /"
root=$work/root

if [ ${#debs[@]} -eq 0 ]; then
  # What the package's scripts do: the shipped sysusers.d and tmpfiles.d
  # snippets make the mobile account and the layout.
  systemd-sysusers --root="$root" vitd.conf && systemd-tmpfiles --root="$root" --create vitd.conf ||
    { echo "FAIL: applying the sysusers.d and tmpfiles.d snippets"; exit 1; }
  chroot "$root" /bin/sh -e -c '
    ldconfig
    groupadd --system vitd
    chgrp vitd /usr/local/bin/vitdctl && chmod 0750 /usr/local/bin/vitdctl
    systemctl enable vitd_helper.socket >/dev/null 2>&1' || { echo "FAIL: setting up the install"; exit 1; }
else
  mkdir -p "$root/tmp/debs" && cp "${debs[@]}" "$root/tmp/debs/"
  chroot "$root" /bin/sh -e -c 'dpkg -i /tmp/debs/*.deb >/tmp/dpkg.log 2>&1 || { cat /tmp/dpkg.log; exit 1; }' ||
    { echo "FAIL: installing the packages"; exit 1; }
fi
# The example client, built as the README says: pkg-config, then the
# entitlement added with objcopy.
chroot "$root" /bin/sh -e -c '
  example=$(pkg-config --variable=prefix vitdclient)/share/doc/libvitdclient-dev/examples/vitd-example.c
  cc -o /usr/local/bin/vitd-example "$example" $(pkg-config --cflags --libs vitdclient)
  objcopy --add-section .vtr_entitlements="$(pkg-config --variable=entitlement vitdclient)" \
    --set-section-flags .vtr_entitlements=readonly /usr/local/bin/vitd-example' ||
  { echo "FAIL: building the example client through pkg-config"; exit 1; }

# A boot disk for the resize commands where loop devices and the tools are
# here: GPT with "System" and "Data" (btrfs, mounted as the data area), the
# volume manager's signature, 4096-byte blocks; bound in as /dev/rdisk0s1.
disk=
disk_binds=()
if command -v sfdisk >/dev/null && command -v mkfs.btrfs >/dev/null && command -v partx >/dev/null &&
   disk=$(losetup -b 4096 -f --show "$(truncate -s 1280M "$work/disk.img" && echo "$work/disk.img")" 2>/dev/null); then
  # The layout of the data-partition tests: "Data" second in the table,
  # behind "Update" on the disk, free blocks after it.
  printf 'label: gpt\ntable-length: 3\nsector-size: 4096\nstart=256, size=16384, name=System\nstart=33024, size=262144, name=Data\nstart=16640, size=16384, name=Update\n' |
    sfdisk -q --no-reread --no-tell-kernel "$disk" &&
    printf 'nraZ' | dd of="$disk" bs=1 seek=440 conv=notrunc status=none && partx -a "$disk" &&
    mkfs.btrfs -q -f "${disk}p2" >/dev/null && mkdir -p "$root/private/var" && mount "${disk}p2" "$root/private/var" ||
    { echo "FAIL: preparing the loop disk"; exit 1; }
  # The disk under its own name too: libblkid reads the table through it.
  disk_binds=(--bind="$disk:/dev/rdisk0s1" --bind="$disk" --bind="${disk}p2")
  echo "${disk}p2" > "$work/data-partition"
else
  echo "note: no loop disk here; the resize commands will answer false"
  disk=
fi

# A user of the vitd group. The mobile account and the data area's layout
# are the packages' own (sysusers.d, tmpfiles.d, applied again at boot on
# the data partition): the checks begin on that stock layout.
chroot "$root" /bin/sh -e -c '
  useradd -M -G vitd demo
  mkdir -p /usr/share/vitd/anchors/production
  systemctl mask systemd-firstboot.service systemd-networkd.service >/dev/null 2>&1 || true
' || { echo "FAIL: preparing the container's root"; exit 1; }
cp "$here/in_container_checks.sh" "$root/root/checks.sh"
[ -n "$disk" ] && echo "$(basename "${disk}")p2" > "$root/root/data-partition"

systemd-nspawn -q -D "$root" --register=no --keep-unit -M vitd-units "${disk_binds[@]}" --boot -- systemd.firstboot=off > "$work/console.log" 2>&1 &
nspawn_pid=$!

# The container's PID 1, seen from here.
leader=
for _ in $(seq 100); do
  leader=$(pgrep -P "$nspawn_pid" | head -n 1)
  [ -n "$leader" ] && [ "$(cat /proc/"$leader"/comm 2>/dev/null)" = systemd ] && break
  sleep 0.1
done
[ -n "$leader" ] || { echo "FAIL: the container did not start"; cat "$work/console.log"; exit 1; }
inside() { nsenter -t "$leader" -m -u -i -n -p -- "$@"; }
for _ in $(seq 300); do
  state=$(inside systemctl is-system-running 2>/dev/null)
  case $state in running|degraded) break ;; esac
  sleep 0.2
done
echo "container: $state"

# The checks end by asking for a reboot, which also ends them.
{ inside bash /root/checks.sh; } 2>/dev/null  # the shell would report the kill
if [ "$(cat "$root/root/checks.result" 2>/dev/null)" != passed ]; then
  echo "FAIL: checks inside the container failed"
  exit 1
fi

# The last check asked the helper to reboot: the container ends with it.
for _ in $(seq 150); do kill -0 "$nspawn_pid" 2>/dev/null || break; sleep 0.2; done
if kill -0 "$nspawn_pid" 2>/dev/null; then echo "FAIL: the container did not reboot"; exit 1; fi
wait "$nspawn_pid"; code=$?
# systemd-nspawn exits 133 when the container rebooted.
[ $code -eq 133 ] || { echo "FAIL: systemd-nspawn ended with $code, not 133 (reboot)"; tail -n 20 "$work/console.log"; exit 1; }
nspawn_pid=
echo "PASS: the confined helper served every command and rebooted the container"
