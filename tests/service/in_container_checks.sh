#!/usr/bin/env bash
# Run inside the booted container by systemd_units_test.sh: drives the
# socket-activated, confined helper through every command. Writes "passed"
# or "failed" to /root/checks.result before it asks for the reboot, which
# ends the container (and this script).
set -u
V=$(command -v vitdctl)
failures=0
ok() { echo "ok: $1"; }
bad() { echo "FAIL: $1"; failures=$((failures + 1)); }
check() { local what=$1; shift; if "$@"; then ok "$what"; else bad "$what"; fi; }
# expect STATUS WHAT COMMAND...: the command's exit status is STATUS.
expect() {
  local want=$1 what=$2; shift 2
  "$@" > /tmp/out 2> /tmp/err; local got=$?
  if [ "$got" -eq "$want" ]; then ok "$what"; else bad "$what (exit $got, want $want): $(cat /tmp/out /tmp/err)"; fi
}
main_pid() { systemctl show -p MainPID --value vitd_helper.service; }

# A plain folder stands in for efivarfs (the container has no firmware);
# mounted before the helper first starts, so its namespace has it.
mount -t tmpfs -o mode=0755 firmware /sys/firmware && mkdir -p /sys/firmware/efi/efivars

exposure=$(systemd-analyze security vitd_helper.service 2>/dev/null | awk '/Overall exposure level/ { print $(NF - 2) }')
check "systemd-analyze security rates the service below 3.0 (${exposure:-none})" \
  awk -v e="${exposure:-10}" 'BEGIN { exit !(e < 3.0) }'
verify=$(systemd-analyze verify vitd_helper.service vitd_helper.socket 2>&1)
check "systemd-analyze verify is clean${verify:+: $verify}" [ -z "$verify" ]
check "the socket listens" [ "$(systemctl is-active vitd_helper.socket)" = active ]
check "the helper waits for its first client" [ "$(systemctl is-active vitd_helper.service)" != active ]

check "the packages made the mobile account" getent passwd mobile
check "the packages made the layout" [ "$(stat -c %U /private/var/mobile/Library/Preferences)" = mobile ] &&
  [ -d /private/var/root/Library/Preferences ] && [ -d /private/var/logs ]
expect 0 "vitdctl status: the socket listens, the helper is not started yet" $V status
check "status names the socket unit and the logs" grep -q "vitd_helper.socket: active" /tmp/out &&
  grep -q "journalctl -t vitd_helper" /tmp/out
# The README's first command, on that stock layout.
expect 0 "prepareWorkContainer starts the helper through the socket" \
  $V --timeout 20 prepareWorkContainer /private/var/VTRWorkContainer
# The device's content the later commands work on.
printf "<plist version=\"1.0\"><dict><key>DemoMode</key><true/></dict></plist>\n" \
  > /private/var/root/Library/Preferences/com.orvane.Vitrell.plist
mkdir -p /private/var/mobile/Media/DCIM && printf "a photo" > /private/var/mobile/Media/DCIM/IMG_0001.JPG
pid=$(main_pid)
check "the helper runs (pid $pid)" [ "$pid" -gt 0 ]
status=$(cat /proc/"$pid"/status)
# The twelve the unit names (0x9168021f), as far as this container has them.
ours=$(awk '/^CapBnd:/ { print $2 }' /proc/1/status)
want=$(printf '%016x' $((0x9168021f & 0x$ours)))
check "the helper's capability bounding set is the twelve it needs ($want)" \
  grep -q "^CapBnd:[[:space:]]*$want$" <<<"$status"
check "no new privileges" grep -q "^NoNewPrivs:[[:space:]]*1$" <<<"$status"
check "a system-call filter" grep -q "^Seccomp:[[:space:]]*2$" <<<"$status"
check "the helper cannot write /usr or /etc but can write the data area" \
  nsenter -t "$pid" -m -- sh -c 'test ! -w /usr && test ! -w /etc && test -w /private/var'
check "the helper has no network but loopback" \
  [ "$(awk -F: 'NR > 2 { gsub(/ /, "", $1); print $1 }' /proc/"$pid"/net/dev)" = lo ]

expect 0 "migratePreferencesFile" $V migratePreferencesFile
expect 1 "migratePreferencesFile again: nothing to move" $V migratePreferencesFile
check "vitdctl says where the reason is" grep -q "journalctl -t vitd_helper -p err" /tmp/err
check "the preferences file belongs to mobile" \
  [ "$(stat -c %U /private/var/mobile/Library/Preferences/com.orvane.Vitrell.plist)" = mobile ]
mkdir -p /private/var/logs/demo
expect 0 "prepareLogContainer" $V prepareLogContainer /private/var/logs/demo
expect 1 "prepareLogContainer outside /var/logs is refused" $V prepareLogContainer /tmp/elsewhere
expect 0 "createDeviceManifest of the whole device, with progress" $V createDeviceManifest /private/var
check "the manifest was written" [ -s /private/var/VTRWorkContainer/DeviceManifest.plist ]
check "progress came with it" grep -q '"Progress"' /tmp/out
expect 0 "prepareWorkContainer for staging" $V prepareWorkContainer /private/var/staging
expect 0 "createHardLink" $V createHardLink /private/var/mobile/Media /private/var/staging/Media
check "the staged file is the same inode" \
  [ "$(stat -c %i /private/var/mobile/Media/DCIM/IMG_0001.JPG)" = "$(stat -c %i /private/var/staging/Media/DCIM/IMG_0001.JPG)" ]

# A signed manifest of the media under a test anchor, laid onto a copy.
pki=$(mktemp -d)
openssl req -x509 -newkey rsa:2048 -nodes -sha1 -days 2 -subj "/CN=Units Root" \
  -keyout "$pki/root.key" -out /usr/share/vitd/anchors/production/root.pem 2>/dev/null
openssl req -newkey rsa:2048 -nodes -subj "/CN=Units Signer" -keyout "$pki/signer.key" -out "$pki/signer.csr" 2>/dev/null
openssl x509 -req -sha1 -days 1 -in "$pki/signer.csr" -CA /usr/share/vitd/anchors/production/root.pem \
  -CAkey "$pki/root.key" -CAcreateserial -out "$pki/signer.pem" 2>/dev/null
chmod 0640 /private/var/mobile/Media/DCIM/IMG_0001.JPG
vtr-manifest create /private/var/mobile/Media -o "$pki/media.plist" >/dev/null 2>&1
vtr-manifest sign "$pki/media.plist" --key "$pki/signer.key" --certificate "$pki/signer.pem" \
  -o /private/var/mobile/signed.plist >/dev/null 2>&1
cp -a /private/var/mobile/Media /private/var/restored && chmod 0600 /private/var/restored/DCIM/IMG_0001.JPG
expect 0 "restoreAttributes" $V restoreAttributes /private/var/restored /private/var/mobile/signed.plist
check "the recorded mode is back" [ "$(stat -c %a /private/var/restored/DCIM/IMG_0001.JPG)" = 640 ]
expect 0 "moveStagingToFinal" $V moveStagingToFinal /private/var/staging
check "the staging area is /var/backup" [ -d /private/var/backup/Media ]
expect 0 "removeWorkContainer" $V removeWorkContainer /private/var/restored

expect 0 "writeNvram" $V writeNvram demo-mode on
check "the variable's file was written" [ -s /sys/firmware/efi/efivars/demo-mode-da3c1531-e7a2-45a1-875c-5c2980f00b0d ]
expect 0 "deleteNvram" $V deleteNvram demo-mode
check "the variable is gone" [ ! -e /sys/firmware/efi/efivars/demo-mode-da3c1531-e7a2-45a1-875c-5c2980f00b0d ]
if [ -f /root/data-partition ]; then
  # A loop disk with a btrfs data partition mounted as /private/var.
  part=$(cat /root/data-partition)
  blocks() { cat /sys/class/block/"$part"/size; }
  before=$(blocks)
  expect 0 "shrinkDataPartition through the confined helper" $V --timeout 60 shrinkDataPartition
  shrunk=$(blocks)
  check "the data partition is smaller ($before -> $shrunk sectors)" [ "$shrunk" -lt "$before" ]
  expect 0 "expandDataPartition through the confined helper" $V --timeout 60 expandDataPartition
  check "the data partition grew again ($(blocks) sectors)" [ "$(blocks)" -gt "$shrunk" ]
  # On a failure, what the helper said about it.
  [ $failures -eq 0 ] || journalctl --no-pager -o cat -t vitd_helper | grep -A25 "shrinkDataPartition" | head -40
  check "the data area is still there" [ -d /private/var/backup/Media ]
  resize_error="^$"
else
  # No partitioned boot disk here: both answer false, and the filter lets them get that far.
  expect 1 "shrinkDataPartition answers (no disk here)" $V shrinkDataPartition
  expect 1 "expandDataPartition answers (no disk here)" $V expandDataPartition
  resize_error="failed to open /dev/rdisk0s1"
fi
check "the helper survived every command" [ "$(main_pid)" = "$pid" ]

expect 0 "a member of the vitd group drives the helper with vitdctl" \
  runuser -u demo -- $V prepareWorkContainer /private/var/FromDemo
check "anyone else cannot run vitdctl" \
  bash -c "runuser -u nobody -- $V prepareWorkContainer /private/var/X 2>&1 | grep -q 'Permission denied'"
expect 0 "the example client drives the helper" vitd-example prepareWorkContainer '"/private/var/FromExample"'
check "the example client's container exists" [ -d /private/var/FromExample ]

sleep 1  # journald receives asynchronously
errors=$(journalctl --no-pager -o cat -t vitd_helper -p err)
notices=$(journalctl --no-pager -o cat -t vitd_helper)
check "a refusal is in the journal at error priority" grep -q "creating logs under /tmp/elsewhere is not allowed" <<<"$errors"
check "a false answer's reason is in the journal at error priority" \
  grep -q "^Nothing to move: /var/root/Library/Preferences/com.orvane.Vitrell.plist: No such file or directory" <<<"$errors"
check "the journal names the command that answered false" grep -q "^migratePreferencesFile: answered NO for" <<<"$errors"
check "the day file keeps only its own lines" bash -c '! grep -q "answered NO\|Nothing to move" /private/var/logs/vitd/vitd_helper-*.log'
[ "$resize_error" = "^$" ] ||
  check "a failed resize is in the journal at error priority" grep -q "$resize_error" <<<"$errors"
check "command entries are notices, not errors" bash -c '! grep -q "^Entering" <<<"$1" && grep -q "^Entering" <<<"$2"' _ "$errors" "$notices"
check "the day log file is written" ls /private/var/logs/vitd/vitd_helper-*.log

expect 0 "quitHelper" $V quitHelper
sleep 0.5
check "the helper ended cleanly" [ "$(systemctl show -p Result --value vitd_helper.service)" = success ]
check "the socket still listens" [ "$(systemctl is-active vitd_helper.socket)" = active ]
expect 0 "the next client starts it again" $V prepareWorkContainer /private/var/Again
check "it runs again" [ "$(main_pid)" -gt 0 ]

if [ $failures -eq 0 ]; then echo passed > /root/checks.result; else echo failed > /root/checks.result; fi
echo "$failures failures; asking for the reboot"
$V --timeout 10 reboot
