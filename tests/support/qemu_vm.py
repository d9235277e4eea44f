"""One run of a QEMU virtual machine on UEFI firmware, watched through its
monitor (QMP): how the guest ended it ("guest-reset", "guest-shutdown"), or
that the power was cut (the process killed) when the caller asked."""
import ctypes
import json
import os
import shutil
import signal
import socket
import subprocess
import time

QEMU = shutil.which("qemu-system-x86_64")
OVMF_CODE = "/usr/share/OVMF/OVMF_CODE_4M.fd"
OVMF_VARS = "/usr/share/OVMF/OVMF_VARS_4M.fd"
SKIP = 77


def missing_qemu():
    """Why no virtual machine can run here, or None."""
    if not QEMU:
        return "missing qemu-system-x86_64 (apt-get install qemu-system-x86)"
    for path in (OVMF_CODE, OVMF_VARS):
        if not os.path.exists(path):
            return f"missing {path} (apt-get install ovmf)"
    return None


def firmware_arguments(variables):
    """q35 with OVMF: the code read-only, the variable store a writable copy
    (reused, it keeps the variables across boots)."""
    return ["-machine", "q35", "-display", "none", "-no-reboot", "-nic", "none",
            "-drive", f"if=pflash,format=raw,unit=0,readonly=on,file={OVMF_CODE}",
            "-drive", f"if=pflash,format=raw,unit=1,file={variables}"]


class Run:
    def __init__(self, reason, seconds, power_cut):
        self.reason = reason      # the SHUTDOWN event's reason, None without one
        self.seconds = seconds
        self.power_cut = power_cut


def _die_with_parent():
    """QEMU is killed when the test dies, whatever kills it."""
    ctypes.CDLL(None, use_errno=True).prctl(1, signal.SIGKILL)  # PR_SET_PDEATHSIG


def _connect(path, qemu):
    for _ in range(200):
        monitor = socket.socket(socket.AF_UNIX)
        try:
            monitor.connect(path)
            return monitor
        except OSError:
            monitor.close()
            if qemu.poll() is not None:
                return None
            time.sleep(0.05)
    return None


def run(arguments, folder, timeout, cut_power=None):
    """Runs QEMU with arguments until the guest ends it or timeout seconds
    pass. cut_power, polled every 0.1 s, returns True when the power is to
    be cut: QEMU is killed at once, as a power cut stops a machine. Raises
    AssertionError when QEMU fails on its own."""
    qmp_path = os.path.join(folder, "qmp.sock")
    if os.path.exists(qmp_path):
        os.remove(qmp_path)
    command = [QEMU] + arguments + ["-qmp", f"unix:{qmp_path},server=on,wait=off"]
    started = time.monotonic()
    qemu = subprocess.Popen(command, stdin=subprocess.DEVNULL, stdout=subprocess.DEVNULL, stderr=subprocess.PIPE,
                            preexec_fn=_die_with_parent)
    reason = None
    power_cut = False
    try:
        monitor = _connect(qmp_path, qemu)
        if monitor is not None:
            # The greeting comes first; events follow the capabilities command.
            monitor.sendall(b'{"execute": "qmp_capabilities"}\n')
            monitor.settimeout(0.1)
            pending = b""
            while time.monotonic() - started < timeout:
                if cut_power is not None and cut_power():
                    qemu.kill()
                    power_cut = True
                    break
                try:
                    chunk = monitor.recv(4096)
                except socket.timeout:
                    continue
                except ConnectionError:
                    break
                if not chunk:
                    break
                *lines, pending = (pending + chunk).split(b"\n")
                for line in filter(bytes.strip, lines):
                    message = json.loads(line)
                    if message.get("event") == "SHUTDOWN":
                        reason = message["data"].get("reason")
            monitor.close()
        if not power_cut:
            qemu.wait(timeout=30)
    except subprocess.TimeoutExpired:
        pass
    finally:
        if qemu.poll() is None:
            qemu.kill()
        qemu.wait()
    errors = qemu.stderr.read().decode(errors="replace")
    qemu.stderr.close()
    if qemu.returncode != 0 and not power_cut:
        raise AssertionError(f"qemu exited {qemu.returncode}: {errors}")
    return Run(reason, time.monotonic() - started, power_cut)
