#!/bin/bash
# Run on the demo device at boot (vitd-device-checks.service) from the disk
# lifecycle_test.py attaches; drives the packaged, socket-activated helper
# with vitdctl. Reports on the second serial port, one line a fact:
#   @@ NAME rc=STATUS s=SECONDS    a step: a command, or a check (rc 0 = held)
#   @@ NAME VALUE                  a value for the test to compare
# The phase (first, second; cut-resize, cut-move, after-cut; grow) is in the
# file "phase" next to this script.
set -u
here=$(dirname "$0")
phase=$(cat "$here/phase")
media=/private/var/mobile/Media
final=/private/var/backup
variable=/sys/firmware/efi/efivars/VtrDevice-da3c1531-e7a2-45a1-875c-5c2980f00b0d

step() {
  local name=$1 started=$EPOCHREALTIME rc
  shift
  "$@" > /tmp/step.out 2>&1
  rc=$?
  echo "@@ $name rc=$rc s=$(awk -v a="$started" -v b="$EPOCHREALTIME" 'BEGIN { printf "%.2f", b - a }')"
  if [ $rc -ne 0 ]; then
    sed 's/^/   | /' /tmp/step.out | tail -n 15
    journalctl -t vitd_helper -p err -n 5 -o cat | sed 's/^/   journal: /'
  fi
}
value() { echo "@@ $1 $2"; }
helper_pid() { systemctl show -p MainPID --value vitd_helper.service; }
part=$(basename "$(readlink -f /dev/disk/by-partlabel/Data)")
# The data partition's and its file system's sizes in bytes.
partition_bytes() { echo $(($(cat /sys/class/block/"$part"/size) * 512)); }
fs_bytes() {
  case $(findmnt -n -o FSTYPE /private/var) in
    btrfs) btrfs inspect-internal dump-super /dev/"$part" | awk '$1 == "dev_item.total_bytes" { print $2 }' ;;
    ext4) dumpe2fs -h /dev/"$part" 2>/dev/null | awk -F: '/^Block count/ { c = $2 } /^Block size/ { s = $2 } END { print c * s }' ;;
  esac
}
sizes() { value "$1-partition" "$(partition_bytes)"; value "$1-fs" "$(fs_bytes)"; }
gpt_valid() { sgdisk -v /dev/rdisk0s1 | grep -q '^No problems found'; }
# A tree's files with owner and mode, and their user.* extended attributes
# (one at most a file), as one digest; "none" without the tree.
content() {
  [ -d "$1" ] || { echo none; return; }
  (cd "$1" && find . -type f -printf '%p %u:%g %m\n' | sort && getfattr -R -d -m user. . 2>/dev/null | grep . | paste - - | sort) |
    md5sum | cut -c1-12
}
after_cut() {
  step gpt-valid gpt_valid
  step data-mounted findmnt /private/var
  sizes after-cut
  value final-content "$(content $final)"
}

value phase "$phase"
value uptime "$(cut -d' ' -f1 /proc/uptime)"
value boot-disk "$(readlink -f /dev/rdisk0s1)"

case $phase in
first)
  step socket-listens test "$(systemctl is-active vitd_helper.socket)" = active
  step helper-waits test "$(systemctl is-active vitd_helper.service)" != active
  step migrate-preferences vitdctl migratePreferencesFile
  step preferences-belong-to-mobile \
    test "$(stat -c %U /private/var/mobile/Library/Preferences/com.orvane.Vitrell.plist)" = mobile
  step work-container vitdctl prepareWorkContainer /private/var/VTRWorkContainer
  mkdir -p /private/var/logs/demo
  step log-container vitdctl prepareLogContainer /private/var/logs/demo
  step device-manifest vitdctl createDeviceManifest /private/var
  cp /tmp/step.out /tmp/manifest.out
  step manifest-progress grep -q '"Progress"' /tmp/manifest.out
  step manifest-written test -s /private/var/VTRWorkContainer/DeviceManifest.plist

  # The content and its signed manifest, then attributes gone wrong.
  mkdir -p $media/Album
  for i in 1 2 3; do head -c $((i * 40000)) /dev/urandom > $media/Album/IMG_000$i.JPG; done
  chown -R mobile:mobile $media && chmod 0640 $media/Album/*.JPG
  setfattr -n user.vitd.origin -v camera $media/Album/IMG_0002.JPG
  value content-recorded "$(content $media)"
  vtr-manifest create $media -o /tmp/media.plist > /dev/null 2>&1 &&
    vtr-manifest sign /tmp/media.plist --key "$here/signer.key" --certificate "$here/signer.pem" \
      -o /private/var/mobile/signed.plist > /dev/null 2>&1
  chmod 0600 $media/Album/*.JPG
  setfattr -x user.vitd.origin $media/Album/IMG_0002.JPG

  step staging-container vitdctl prepareWorkContainer /private/var/staging
  step hard-link vitdctl createHardLink $media /private/var/staging/Media
  step staged-is-same-inode \
    test "$(stat -c %i $media/Album/IMG_0003.JPG)" = "$(stat -c %i /private/var/staging/Media/Album/IMG_0003.JPG)"
  # A file of more than one link never changes owner; one left with a
  # single link gets its owner back.
  rm $media/Album/IMG_0001.JPG && chown root:root /private/var/staging/Media/Album/IMG_0001.JPG
  step restore-attributes vitdctl restoreAttributes /private/var/staging/Media /private/var/mobile/signed.plist
  step move-to-final vitdctl moveStagingToFinal /private/var/staging
  value content-final "$(content $final/Media)"

  step write-variable vitdctl writeNvram VtrDevice "written on the first boot"
  value variable-in-efivarfs "$(cat $variable | tail -c +5)"
  sizes before-shrink
  step shrink vitdctl --timeout 300 shrinkDataPartition
  sizes after-shrink
  step gpt-valid-after-shrink gpt_valid
  journalctl --sync
  echo "@@ rebooting"
  vitdctl --timeout 60 reboot
  echo "@@ still-running"
  ;;
second)
  value variable-in-efivarfs "$(cat $variable | tail -c +5)"
  step gpt-valid gpt_valid
  sizes after-reboot
  value content-final "$(content $final/Media)"
  step journal-of-first-boot journalctl -b -1 -t vitd_helper -o cat --grep 'Entering -\[VTRHMessageResponder shrinkDataPartition:\]'
  step journal-table-written journalctl -b -1 -t vitd_helper -o cat --grep 'Wrote GPT header back to disk'
  step expand vitdctl --timeout 300 expandDataPartition
  sizes after-expand
  step gpt-valid-after-expand gpt_valid
  step delete-variable vitdctl deleteNvram VtrDevice
  step variable-gone test ! -e $variable
  pid=$(helper_pid)
  step quit vitdctl quitHelper
  sleep 1
  step helper-ended-cleanly test "$(systemctl show -p Result --value vitd_helper.service)" = success
  step helper-stopped test "$(systemctl is-active vitd_helper.service)" != active
  step socket-still-listens test "$(systemctl is-active vitd_helper.socket)" = active
  step socket-starts-it-again vitdctl prepareWorkContainer /private/var/Again
  step a-new-helper test "$(helper_pid)" -gt 0 -a "$(helper_pid)" != "$pid"
  journalctl --sync
  echo "@@ done"
  systemctl poweroff
  ;;
cut-resize)
  # Data high on the volume: the shrink moves it, which takes seconds.
  dd if=/dev/zero of=/private/var/fill-1 bs=1M count=250 status=none
  dd if=/dev/zero of=/private/var/fill-2 bs=1M count=150 status=none
  rm /private/var/fill-1 && sync
  sizes before-cut
  systemctl start vitd_helper.service
  echo "@@ cut-soon"
  step shrink vitdctl --timeout 300 shrinkDataPartition
  echo "@@ not-cut"
  systemctl poweroff
  ;;
cut-move)
  after_cut
  # Old content in the final place, new content in staging; many files, so
  # that the move takes a while.
  mkdir -p $final/Media /private/var/staging/Media
  (cd $final/Media && seq -f old%g 4000 | xargs touch)
  (cd /private/var/staging/Media && seq -f new%g 4000 | xargs touch && chown mobile *1)
  value old-content "$(content $final)"
  value new-content "$(content /private/var/staging)"
  sync
  # The cut comes once the old content is being removed.
  (while [ "$(ls $final/Media 2>/dev/null | wc -l)" -ge 4000 ]; do :; done; echo "@@ cut-now") &
  vitdctl --timeout 300 moveStagingToFinal /private/var/staging
  echo "@@ not-cut"
  systemctl poweroff
  ;;
after-cut)
  after_cut
  value staging-content "$(content /private/var/staging)"
  systemctl poweroff
  ;;
grow)
  # ext4 grows online (the helper needs CAP_SYS_RESOURCE for it) but cannot
  # shrink.
  sizes before-grow
  step shrink vitdctl --timeout 300 shrinkDataPartition
  step expand vitdctl --timeout 300 expandDataPartition
  sizes after-grow
  step gpt-valid gpt_valid
  step data-mounted findmnt /private/var
  systemctl poweroff
  ;;
esac
