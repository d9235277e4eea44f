#!/usr/bin/env python3
"""The firmware-variable and reboot commands on real UEFI firmware.

Boots a tiny Linux (a Debian kernel, a busybox initramfs holding the helper,
vitdctl and their libraries) under QEMU with OVMF, twice, on one variable
store:

  boot 1  the helper serves the machine; vitdctl writes, overwrites, deletes
          and reads variables through it (empty and non-ASCII values
          included), then sends "reboot:". QEMU runs with -no-reboot, so the
          reset ends it; its monitor must report SHUTDOWN "guest-reset".
  boot 2  on the same store: what boot 1 left is there, a variable that the
          kernel marked immutable at mount is overwritten, and the guest
          powers off ("guest-shutdown").

Usage: efi_vm_test.py BIN_DIR   (the folder of the built vitd_helper and
vitdctl). Exits 77 (skipped) with the reason when QEMU, OVMF, busybox or the
kernel (tests/firmware/fetch-kernel) is missing.
"""
import gzip
import json
import os
import re
import shutil
import subprocess
import sys
import tempfile
import unittest

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, os.path.join(HERE, "..", "support"))
import qemu_vm  # noqa: E402

BIN = sys.argv[1] if len(sys.argv) > 1 else os.path.join(HERE, "..", "..", "build", "bin")
CACHE = os.environ.get("VTR_VM_CACHE", "/var/cache/vitd-tests")
KERNEL_DIR = os.path.join(CACHE, "kernel")
BUSYBOX = shutil.which("busybox")
BOOT_TIMEOUT = 240  # seconds; a boot takes about 10 s under software emulation
GUID = "da3c1531-e7a2-45a1-875c-5c2980f00b0d"

# The guest's /init. Each step prints "@@ NAME rc=STATUS"; listings are
# printed between "@@ NAME begin" and "@@ NAME end".
INIT = r"""#!/bin/busybox sh
/bin/busybox --install -s /bin
mount -t proc proc /proc
mount -t sysfs sys /sys
mount -t devtmpfs dev /dev
insmod /efivarfs.ko
mount -t efivarfs efivarfs /sys/firmware/efi/efivars
export ASAN_OPTIONS=detect_leaks=0
phase=$(sed -n 's/.*vtrphase=\([a-z]*\).*/\1/p' /proc/cmdline)

step() { name=$1; shift; "$@" >/dev/null 2>&1; echo "@@ $name rc=$?"; }
listing() { echo "@@ $1 begin"; vitdctl listNvram --json; echo "@@ $1 end"; }
# Busybox has no lsattr: an immutable file refuses to be opened for writing
# (an open that succeeds writes nothing, so the variable stays as it is).
immutable() { if (: >>"/sys/firmware/efi/efivars/$1-GUID") 2>/dev/null; then echo -; else echo i; fi; }

/usr/bin/vitd_helper --stderr 2>/helper.log &
# Up once a command is answered (removing a variable that is not there).
for i in $(seq 100); do vitdctl deleteNvram VtrTestProbe >/dev/null 2>&1 && break; sleep 0.1; done
echo; echo "@@ phase $phase"  # the firmware leaves its screen codes on the line

if [ "$phase" = first ]; then
  step write-long vitdctl writeNvram VtrTestA "a first value, longer than the next"
  step overwrite vitdctl writeNvram VtrTestA "second"
  echo "@@ immutable-after-write $(immutable VtrTestA)"
  step write-utf8 vitdctl writeNvram VtrTestB "gr$(printf '\303\274\303\237') dich $(printf '\342\234\223')"
  step write-doomed vitdctl writeNvram VtrTestC "to be deleted"
  step delete vitdctl deleteNvram VtrTestC
  step delete-absent vitdctl deleteNvram VtrTestC
  step write-then-empty vitdctl writeNvram VtrTestD "x"
  step empty-existing vitdctl writeNvram VtrTestD ""
  step empty-new vitdctl writeNvram VtrTestE ""
  step bad-name vitdctl writeNvram "/VtrTestF" "x"
  listing before-reboot
  echo "@@ helper-log begin"; cat /helper.log; echo "@@ helper-log end"
  step reboot vitdctl --timeout 20 reboot
  echo "@@ still-running"
else
  listing after-reboot
  echo "@@ immutable-after-mount $(immutable VtrTestA)"
  step overwrite-after-mount vitdctl writeNvram VtrTestA "third"
  echo "@@ immutable-after-overwrite $(immutable VtrTestA)"
  listing after-overwrite
  step cleanup-a vitdctl deleteNvram VtrTestA
  step cleanup-b vitdctl deleteNvram VtrTestB
  listing after-cleanup
fi
poweroff -f
""".replace("GUID", GUID)


def missing_requirement():
    """Why the test cannot run here, or None."""
    why = qemu_vm.missing_qemu()
    if why:
        return why
    for path, why in ((BUSYBOX, "busybox (apt-get install busybox-static)"),
                      (shutil.which("cpio"), "cpio (apt-get install cpio)")):
        if not path:
            return "missing " + why
    for name in ("vmlinuz", "efivarfs.ko"):
        if not os.path.exists(os.path.join(KERNEL_DIR, name)):
            return f"missing {KERNEL_DIR}/{name} (run tests/firmware/fetch-kernel)"
    for name in ("vitd_helper", "vitdctl"):
        if not os.access(os.path.join(BIN, name), os.X_OK):
            return f"missing {os.path.join(BIN, name)} (build first)"
    return None


def libraries_of(executable):
    """The shared libraries and the loader executable needs, as ldd names them."""
    out = subprocess.run(["ldd", executable], capture_output=True, text=True, check=True).stdout
    paths = set()
    for line in out.splitlines():
        match = re.search(r"(/\S+) \(0x", line)
        if match:
            paths.add(match.group(1))
    return paths


def copy_into(root, path, target=None):
    destination = os.path.join(root, (target or path).lstrip("/"))
    os.makedirs(os.path.dirname(destination), exist_ok=True)
    shutil.copy2(os.path.realpath(path), destination)
    os.chmod(destination, 0o755)


def make_initramfs(folder):
    """The guest's initramfs: busybox, the two programs and their libraries."""
    root = os.path.join(folder, "initramfs")
    for d in ("bin", "usr/bin", "proc", "sys", "dev", "run", "tmp", "etc", "private/var/logs", "private/var/mobile"):
        os.makedirs(os.path.join(root, d), exist_ok=True)
    os.symlink("private/var", os.path.join(root, "var"))
    copy_into(root, BUSYBOX, "/bin/busybox")
    libraries = set()
    for name in ("vitd_helper", "vitdctl"):
        copy_into(root, os.path.join(BIN, name), "/usr/bin/" + name)
        libraries |= libraries_of(os.path.join(BIN, name))
    for library in libraries:
        copy_into(root, library)
    shutil.copy(os.path.join(KERNEL_DIR, "efivarfs.ko"), os.path.join(root, "efivarfs.ko"))
    with open(os.path.join(root, "etc/passwd"), "w") as f:
        f.write("root:x:0:0:root:/var/root:/bin/sh\nmobile:x:501:501:Mobile User:/var/mobile:/bin/sh\n")
    with open(os.path.join(root, "etc/group"), "w") as f:
        f.write("root:x:0:\nmobile:x:501:\n")
    with open(os.path.join(root, "init"), "w") as f:
        f.write(INIT)
    os.chmod(os.path.join(root, "init"), 0o755)
    # Every file root's: the helper trusts only a root-owned client.
    names = subprocess.run(["find", "."], cwd=root, capture_output=True, check=True).stdout
    archive = subprocess.run(["cpio", "-o", "-H", "newc", "-R", "0:0", "--quiet"], cwd=root, input=names,
                             capture_output=True, check=True).stdout
    initrd = os.path.join(folder, "initrd.gz")
    with gzip.open(initrd, "wb", compresslevel=1) as f:
        f.write(archive)
    shutil.rmtree(root)
    return initrd


class Boot:
    """One boot: the guest's console text and how QEMU said it ended."""

    def __init__(self, console, reason, seconds):
        self.console = console
        self.reason = reason
        self.seconds = seconds

    def steps(self):
        return dict(re.findall(r"^@@ (\S+) rc=(\d+)\s*$", self.console, re.M))

    def value(self, name):
        match = re.search(rf"^@@ {name} (.*?)\s*$", self.console, re.M)
        return match.group(1) if match else None

    def block(self, name):
        match = re.search(rf"^@@ {name} begin\s*$(.*?)^@@ {name} end\s*$", self.console, re.M | re.S)
        return match.group(1) if match else None

    def variables(self, name):
        """{name: value} of a listing, this system's test variables only."""
        text = self.block(name)
        if text is None:
            return None
        return {v["name"]: v["value"] for v in json.loads(text) if v["name"].startswith("VtrTest")}


def boot(folder, initrd, phase):
    console = os.path.join(folder, f"console-{phase}.log")
    arguments = qemu_vm.firmware_arguments(os.path.join(folder, "vars.fd")) + [
        "-m", "512", "-smp", "1",
        "-kernel", os.path.join(KERNEL_DIR, "vmlinuz"), "-initrd", initrd,
        "-append", f"console=ttyS0 quiet loglevel=1 panic=-1 vtrphase={phase}",
        "-serial", f"file:{console}"]
    run = qemu_vm.run(arguments, folder, BOOT_TIMEOUT)
    with open(console, errors="replace") as f:
        text = f.read().replace("\r", "")
    return Boot(text, run.reason, run.seconds)


class FirmwareVariablesTest(unittest.TestCase):
    def test_variables_survive_a_reboot_made_by_the_helper(self):
        with tempfile.TemporaryDirectory(prefix="vtr-vm.") as folder:
            shutil.copy(qemu_vm.OVMF_VARS, os.path.join(folder, "vars.fd"))
            initrd = make_initramfs(folder)

            first = boot(folder, initrd, "first")
            print(f"boot 1: {first.seconds:.1f} s, ended by {first.reason}", flush=True)
            steps = first.steps()
            context = first.console[-4000:]
            for name in ("write-long", "overwrite", "write-utf8", "write-doomed", "delete", "delete-absent",
                         "write-then-empty", "empty-existing", "empty-new"):
                self.assertEqual(steps.get(name), "0", f"{name}\n{context}")
            self.assertEqual(steps.get("bad-name"), "1", context)
            self.assertEqual(first.value("immutable-after-write"), "i", context)
            self.assertEqual(first.variables("before-reboot"),
                             {"VtrTestA": "second", "VtrTestB": "gr\u00fc\u00df dich \u2713"}, context)
            # The reset ended the guest while "reboot:" was being answered: no
            # step after it ran, and QEMU saw the guest reset itself.
            self.assertNotIn("@@ still-running", first.console, context)
            self.assertNotIn("reboot", steps, context)
            self.assertEqual(first.reason, "guest-reset", context)

            second = boot(folder, initrd, "second")
            print(f"boot 2: {second.seconds:.1f} s, ended by {second.reason}", flush=True)
            context = second.console[-4000:]
            self.assertEqual(second.value("phase"), "second", context)
            self.assertEqual(second.variables("after-reboot"),
                             {"VtrTestA": "second", "VtrTestB": "gr\u00fc\u00df dich \u2713"}, context)
            self.assertEqual(second.value("immutable-after-mount"), "i", context)
            steps = second.steps()
            self.assertEqual(steps.get("overwrite-after-mount"), "0", context)
            self.assertEqual(second.value("immutable-after-overwrite"), "i", context)
            self.assertEqual(second.variables("after-overwrite")["VtrTestA"], "third", context)
            self.assertEqual((steps.get("cleanup-a"), steps.get("cleanup-b")), ("0", "0"), context)
            self.assertEqual(second.variables("after-cleanup"), {}, context)
            self.assertEqual(second.reason, "guest-shutdown", context)


if __name__ == "__main__":
    why = missing_requirement()
    if why:
        print(f"SKIPPED: the firmware test cannot run here: {why}")
        sys.exit(qemu_vm.SKIP)
    result = unittest.main(argv=sys.argv[:1], exit=False).result
    sys.exit(0 if result.wasSuccessful() else 1)
