#!/usr/bin/env python3
"""The demo device's life cycle, on the image scripts/device builds.

Boots the image under QEMU with OVMF twice on one firmware variable store;
on each boot a disk this test attaches runs guest_checks.sh, which drives
the packaged, socket-activated helper with vitdctl and reports on the second
serial port:

  boot 1  preferences migrated, work and log containers, the device
          manifest (with progress), content hard-linked into staging, its
          attributes restored from a signed manifest, moved to its final
          place, a firmware variable written, the data partition shrunk,
          then "reboot:" (QEMU sees the guest reset)
  boot 2  the variable (in efivarfs, and in the firmware's store on the
          host), both GPT copies, the partition and its file system at the
          new size, the final content whole, the journal of boot 1; then the
          partition expanded, the variable deleted, the helper quit and
          started again by the socket; the guest powers off

Prints the time of the image build, each boot and each step.
Usage: lifecycle_test.py   (exits 77, skipped, with the reason when QEMU,
OVMF, root or the Debian archive for a first build is missing)
"""
import io
import os
import re
import shutil
import signal
import subprocess
import sys
import tarfile
import tempfile
import time
import unittest
import urllib.request

HERE = os.path.dirname(os.path.abspath(__file__))
TREE = os.path.normpath(os.path.join(HERE, "..", ".."))
sys.path.insert(0, os.path.join(TREE, "tests", "support"))
import qemu_vm  # noqa: E402

CACHE = os.environ.get("VTR_DEVICE_CACHE", "/var/cache/vitd-device")
BOOT_TIMEOUT = 900  # seconds for one boot with its steps; a boot takes about a minute
VARIABLE_VALUE = "written on the first boot"


def missing_requirement():
    """Why the test cannot run here, or None."""
    why = qemu_vm.missing_qemu()
    if why:
        return why
    if os.geteuid() != 0:
        return "building the device image needs root"
    cached = os.path.isdir(CACHE) and any(n.startswith("base-") and n.endswith(".tar") for n in os.listdir(CACHE))
    if not cached:
        if not shutil.which("mmdebstrap"):
            return "no cached device base and no mmdebstrap (scripts/install-deps)"
        try:
            urllib.request.urlopen("http://deb.debian.org/debian/dists/bookworm/InRelease", timeout=15).close()
        except OSError as error:
            return f"no cached device base and the Debian archive is not reachable ({error})"
    return None


def build_image(data_fs="btrfs"):
    started = time.monotonic()
    out = subprocess.run([os.path.join(TREE, "scripts", "device"), "build", "--data-fs", data_fs],
                         capture_output=True, text=True)
    if out.returncode != 0:
        raise AssertionError(f"scripts/device build failed:\n{out.stderr[-4000:]}")
    print(f"image ({data_fs}): {time.monotonic() - started:.1f} s (scripts/device build) {out.stderr.strip()}",
          flush=True)
    return out.stdout.strip().splitlines()[-1]


class Boot:
    """What one boot reported on the second serial port."""

    def __init__(self, run, report, console, boot_seconds):
        self.run = run
        self.report = report
        self.console = console
        self.boot_seconds = boot_seconds  # from power-on until the checks started

    def steps(self):
        return {name: (int(rc), float(s)) for name, rc, s in
                re.findall(r"^@@ (\S+) rc=(\d+) s=([\d.]+)\s*$", self.report, re.M)}

    def value(self, name):
        match = re.search(rf"^@@ {re.escape(name)} (.*?)\s*$", self.report, re.M)
        return match.group(1) if match else None

    def number(self, name):
        return int(self.value(name) or -1)

    def context(self):
        return f"--- report\n{self.report[-5000:]}\n--- console\n{self.console[-3000:]}"


class Device:
    """A copy of the image, its variable store, and the checks disk."""

    def __init__(self, folder, image):
        self.folder = folder
        self.disk = os.path.join(folder, "disk.img")
        self.variables = os.path.join(folder, "vars.fd")
        subprocess.run(["cp", "--sparse=always", image, self.disk], check=True)
        shutil.copy(qemu_vm.OVMF_VARS, self.variables)
        self.signer = self._make_signer()
        self.count = 0

    def _make_signer(self):
        """A signing certificate from the test authority the image trusts."""
        ca = os.path.join(CACHE, "test-ca")
        key, csr, pem = (os.path.join(self.folder, n) for n in ("signer.key", "signer.csr", "signer.pem"))
        subprocess.run(["openssl", "req", "-newkey", "rsa:2048", "-nodes", "-subj", "/CN=Device Test Signer",
                        "-keyout", key, "-out", csr], check=True, capture_output=True)
        subprocess.run(["openssl", "x509", "-req", "-sha256", "-days", "2", "-in", csr, "-CA",
                        os.path.join(ca, "ca.pem"), "-CAkey", os.path.join(ca, "ca.key"),
                        "-set_serial", str(int.from_bytes(os.urandom(8), "big")),
                        "-out", pem], check=True, capture_output=True)
        return key, pem

    def _checks_disk(self, phase):
        path = os.path.join(self.folder, "checks.tar")
        with tarfile.open(path, "w") as archive:
            archive.add(os.path.join(HERE, "guest_checks.sh"), "run")
            archive.add(self.signer[0], "signer.key")
            archive.add(self.signer[1], "signer.pem")
            data = phase.encode()
            info = tarfile.TarInfo("phase")
            info.size = len(data)
            archive.addfile(info, io.BytesIO(data))
        return path

    def boot(self, phase, cut_power=None):
        self.count += 1
        console = os.path.join(self.folder, f"console-{self.count}.log")
        report = os.path.join(self.folder, f"report-{self.count}.log")
        arguments = qemu_vm.firmware_arguments(self.variables) + [
            "-m", "1024", "-smp", "2",
            "-drive", f"if=none,id=boot,format=raw,file={self.disk}",
            "-device", "virtio-blk-pci,drive=boot,logical_block_size=4096,physical_block_size=4096",
            "-drive", f"if=none,id=checks,format=raw,readonly=on,file={self._checks_disk(phase)}",
            "-device", "virtio-blk-pci,drive=checks,serial=vitd-checks",
            "-serial", f"file:{console}", "-serial", f"file:{report}"]
        started = time.monotonic()
        checks_started = []

        def watch():
            text = read(report)
            if not checks_started and "@@ phase" in text:
                checks_started.append(time.monotonic() - started)
            return cut_power is not None and cut_power(text)
        run = qemu_vm.run(arguments, self.folder, BOOT_TIMEOUT, watch)
        return Boot(run, read(report), read(console), checks_started[0] if checks_started else None)

    def firmware_store_holds(self, name, value):
        """Whether the variable store file holds name (UTF-16) and then value."""
        with open(self.variables, "rb") as f:
            store = f.read()
        at = store.rfind(name.encode("utf-16-le") + b"\0\0")
        return at >= 0 and store.find(value.encode(), at) >= 0


def read(path):
    try:
        with open(path, errors="replace") as f:
            return f.read().replace("\r", "")
    except FileNotFoundError:
        return ""


def print_times(label, boot):
    times = ", ".join(f"{name} {s:.2f}" for name, (_, s) in boot.steps().items() if s >= 0.05)
    booted = f"{boot.boot_seconds:.1f}" if boot.boot_seconds else "?"
    print(f"{label}: {boot.run.seconds:.1f} s in QEMU, up after {booted} s (kernel uptime {boot.value('uptime')} s); "
          f"steps: {times}", flush=True)


class LifeCycleTest(unittest.TestCase):
    def assert_steps(self, boot, names):
        steps = boot.steps()
        failed = [n for n in names if steps.get(n, (None,))[0] != 0]
        self.assertEqual(failed, [], boot.context())

    def test_life_cycle_across_a_reboot(self):
        image = build_image()
        with tempfile.TemporaryDirectory(prefix="vitd-device.", dir="/var/tmp") as folder:
            device = Device(folder, image)

            first = device.boot("first")
            print_times("boot 1", first)
            self.assert_steps(first, [
                "socket-listens", "helper-waits", "migrate-preferences", "preferences-belong-to-mobile",
                "work-container", "log-container", "device-manifest", "manifest-progress", "manifest-written",
                "staging-container", "hard-link", "staged-is-same-inode", "restore-attributes", "move-to-final",
                "write-variable", "shrink", "gpt-valid-after-shrink"])
            self.assertEqual(first.value("boot-disk"), "/dev/vda", first.context())
            self.assertEqual(first.value("content-final"), first.value("content-recorded"), first.context())
            self.assertEqual(first.value("variable-in-efivarfs"), VARIABLE_VALUE, first.context())
            self.assertLess(first.number("after-shrink-partition"), first.number("before-shrink-partition"))
            self.assertEqual(first.number("after-shrink-fs"), first.number("after-shrink-partition"))
            # "reboot:" reset the machine while it was answered.
            self.assertIn("@@ rebooting", first.report, first.context())
            self.assertNotIn("@@ still-running", first.report, first.context())
            self.assertEqual(first.run.reason, "guest-reset", first.context())
            self.assertTrue(device.firmware_store_holds("VtrDevice", VARIABLE_VALUE))

            second = device.boot("second")
            print_times("boot 2", second)
            self.assert_steps(second, [
                "gpt-valid", "journal-of-first-boot", "journal-table-written", "expand", "gpt-valid-after-expand",
                "delete-variable", "variable-gone", "quit", "helper-ended-cleanly", "helper-stopped",
                "socket-still-listens", "socket-starts-it-again", "a-new-helper"])
            self.assertEqual(second.value("variable-in-efivarfs"), VARIABLE_VALUE, second.context())
            self.assertEqual(second.number("after-reboot-partition"), first.number("after-shrink-partition"))
            self.assertEqual(second.number("after-reboot-fs"), first.number("after-shrink-partition"))
            self.assertEqual(second.value("content-final"), first.value("content-recorded"), second.context())
            self.assertEqual(second.number("after-expand-partition"), first.number("before-shrink-partition"))
            self.assertEqual(second.number("after-expand-fs"), second.number("after-expand-partition"))
            self.assertIn("@@ done", second.report, second.context())
            self.assertEqual(second.run.reason, "guest-shutdown", second.context())

    def test_power_cut_during_a_resize_and_a_move(self):
        """The power fails while the helper shrinks the data file system, then
        while it moves staging to the final place: each time the next boot
        finds a valid table, a mounted data volume, and the old or the new
        content whole."""
        image = build_image()
        with tempfile.TemporaryDirectory(prefix="vitd-device.", dir="/var/tmp") as folder:
            device = Device(folder, image)
            cut_now = lambda report: "@@ cut-now" in report  # noqa: E731
            # The shrink moves data high on the volume, which takes seconds:
            # the cut comes a second after it was asked for.
            asked = []

            def during_shrink(report):
                if not asked and "@@ cut-soon" in report:
                    asked.append(time.monotonic())
                return bool(asked) and time.monotonic() - asked[0] > 1.0
            resize = device.boot("cut-resize", during_shrink)
            print(f"cut during the resize: {resize.run.seconds:.1f} s", flush=True)
            self.assertTrue(resize.run.power_cut, resize.context())

            move = device.boot("cut-move", cut_now)
            print_times("after the cut during the resize, cut during the move", move)
            self.assert_steps(move, ["gpt-valid", "data-mounted"])
            self.assertLessEqual(move.number("after-cut-fs"), move.number("after-cut-partition"), move.context())
            self.assertLessEqual(move.number("after-cut-partition"), resize.number("before-cut-partition"))
            print(f"after the cut during the resize: partition {resize.number('before-cut-partition')} -> "
                  f"{move.number('after-cut-partition')} bytes, file system {move.number('after-cut-fs')}", flush=True)
            self.assertTrue(move.run.power_cut, move.context())

            after = device.boot("after-cut")
            print_times("after the cut during the move", after)
            self.assert_steps(after, ["gpt-valid", "data-mounted"])
            # The old content is removed before the new is moved in: cut in
            # between, the new content is whole where it was staged.
            final, staging = after.value("final-content"), after.value("staging-content")
            whole = {move.value("old-content"): "old", move.value("new-content"): "new"}
            self.assertTrue(final in whole or staging == move.value("new-content"), after.context())
            print(f"after the cut: the final place holds {whole.get(final, 'part of the old')} content, "
                  f"staging {'the new content' if staging != 'none' else 'nothing'}", flush=True)

    def test_ext4_grows_online(self):
        """An ext4 data partition with free blocks behind it: the confined
        helper grows it while mounted, and refuses to shrink it."""
        image = build_image("ext4")
        with tempfile.TemporaryDirectory(prefix="vitd-device.", dir="/var/tmp") as folder:
            grow = Device(folder, image).boot("grow")
            print_times("ext4 growth", grow)
            self.assertEqual(grow.steps().get("shrink", (None,))[0], 1, grow.context())
            self.assert_steps(grow, ["expand", "gpt-valid", "data-mounted"])
            self.assertGreater(grow.number("after-grow-partition"), grow.number("before-grow-partition"))
            self.assertEqual(grow.number("after-grow-fs"), grow.number("after-grow-partition"), grow.context())


if __name__ == "__main__":
    why = missing_requirement()
    if why:
        print(f"SKIPPED: the device test cannot run here: {why}")
        sys.exit(qemu_vm.SKIP)
    # Stopped (a test timeout), it still removes its files; QEMU dies with it.
    signal.signal(signal.SIGTERM, lambda *_: sys.exit(1))
    started = time.monotonic()
    result = unittest.main(argv=sys.argv, exit=False).result
    print(f"device test: {time.monotonic() - started:.1f} s")
    sys.exit(0 if result.wasSuccessful() else 1)
