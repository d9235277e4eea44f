#!/usr/bin/env python3
"""Drives vitdctl and vitd_helper from the command line where no helper needs
to run: requests refused before anything is sent, options on either side of
the command, and what a user is told when nothing listens."""
import os
import pty
import socket
import struct
import subprocess
import sys
import tempfile
import threading
import unittest

BIN = None
NOWHERE = "/nonexistent/vitd.sock"  # a request that got through would exit 69


def run(tool, *args, stdin=None):
    return subprocess.run([os.path.join(BIN, tool), *args], input=stdin, capture_output=True, text=True)


def message(key, tag, payload):
    """One frame holding the dictionary {key: value} of the helper's wire format."""
    body = b"\x0a" + struct.pack("<I", 1) + struct.pack("<I", len(key)) + key.encode() + bytes([tag]) + payload
    return struct.pack("<I", len(body)) + body


def on_terminal(args, replies):
    """vitdctl's output on a terminal while a stand-in helper at a socket
    answers any request with replies."""
    with tempfile.TemporaryDirectory() as d:
        path = os.path.join(d, "s")
        server = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
        server.bind(path)
        server.listen(1)

        def serve():
            connection, _ = server.accept()
            connection.recv(65536)
            connection.sendall(b"".join(replies))
            connection.close()

        threading.Thread(target=serve, daemon=True).start()
        primary, secondary = pty.openpty()
        p = subprocess.run([os.path.join(BIN, "vitdctl"), "--socket", path, *args], stdout=secondary,
                           stderr=subprocess.DEVNULL)
        os.close(secondary)
        output = os.read(primary, 65536).decode()
        os.close(primary)
        server.close()
        return p.returncode, output


class VitdctlTest(unittest.TestCase):
    def test_the_bar_stops_at_full_while_json_keeps_the_helpers_value(self):
        replies = [message("Progress", 2, struct.pack("<q", 103)), message("Response", 1, b"\x01")]
        status, bar = on_terminal(["createDeviceManifest", "/private/var"], replies)
        self.assertEqual(status, 0)
        self.assertIn("] 100%", bar)
        self.assertNotIn("103", bar)
        status, lines = on_terminal(["--json", "createDeviceManifest", "/private/var"], replies)
        self.assertIn('{"Progress":103}', lines)

    def test_requests_of_the_wrong_shape_are_refused_before_sending(self):
        cases = [
            ('{"removeWorkContainer": "/x"}', 'keys end in a colon ("removeWorkContainer:")'),
            ('{"frobnicate:": true}', "the helper knows migratePreferencesFile:"),
            ('{"removeWorkContainer:": {"Path": "/x"}}', '"removeWorkContainer:" takes a string'),
            ('{"deleteNvram:": 3}', '"deleteNvram:" takes a string'),
            ('{"createDeviceManifest:": "/private/var"}', "takes a dictionary of Path (a string)"),
            ('{"createDeviceManifest:": {"path": "/x"}}', 'has no entry "path"'),
            ('{"createDeviceManifest:": {"Path": "/x", "Inclusive": "yes"}}', 'entry "Inclusive" must be a boolean'),
            ('{"createHardLink:": {"FilePath": "/a"}}', 'needs the entry "StagingPath"'),
            ('{"restoreAttributes:": {"StagingRootPath": "/a", "ManifestPath": 1}}', 'entry "ManifestPath" must be a string'),
            ('{"writeNvram:": {"Name": "a", "Value": "b", "Extra": 1}}', 'has no entry "Extra"'),
            ("{}", "holds no command"),
        ]
        for request, hint in cases:
            with self.subTest(request=request):
                r = run("vitdctl", "--socket", NOWHERE, "send", "-", stdin=request)
                self.assertEqual(r.returncode, 64, r.stderr)
                self.assertIn(hint, r.stderr)
                self.assertIn("send --raw", r.stderr)

    def test_well_formed_and_raw_requests_go_out(self):
        for args, request in [
            (["send", "-"], '{"prepareWorkContainer:": "/x", "reboot:": [1], "writeNvram:": {"Name": "a", "Value": ""}}'),
            (["send", "-"], '{"createDeviceManifest:": {"Path": "/x", "Inclusive": 1}}'),
            (["send", "--raw", "-"], '{"removeWorkContainer": {"any": 1}}'),
            (["send", "-", "--raw"], '{"zzz:": 1}'),
        ]:
            with self.subTest(request=request):
                r = run("vitdctl", "--socket", NOWHERE, *args, stdin=request)
                self.assertEqual(r.returncode, 69, r.stderr)

    def test_options_stand_before_or_after_the_command(self):
        with tempfile.TemporaryDirectory() as root:
            os.makedirs(os.path.join(root, "sys/firmware/efi/efivars"))
            for args in (["--json", "--root", root, "listNvram"], ["listNvram", "--root", root, "--json"]):
                r = run("vitdctl", *args)
                self.assertEqual((r.returncode, r.stdout.strip()), (0, "[]"), (args, r.stderr))
        for args in (["--socket", NOWHERE, "prepareWorkContainer", "/x"], ["prepareWorkContainer", "/x", "--socket", NOWHERE],
                     ["createDeviceManifest", "--inclusive", "/x", "--socket", NOWHERE]):
            self.assertEqual(run("vitdctl", *args).returncode, 69, args)
        for args in (["prepareWorkContainer", "--inclusive", "/x"], ["send", "--type", "t", "-"], ["status", "x"],
                     ["--raw", "prepareWorkContainer", "/x"], ["prepareWorkContainer"]):
            self.assertEqual(run("vitdctl", "--socket", NOWHERE, *args).returncode, 64, args)

    def test_a_missing_helper_is_reported_with_the_systems_reason_and_a_hint(self):
        r = run("vitdctl", "prepareWorkContainer", "/x", "--socket", NOWHERE)
        self.assertEqual(r.returncode, 69)
        self.assertIn(NOWHERE + ": No such file or directory", r.stderr)
        with tempfile.TemporaryDirectory() as root:
            r = run("vitdctl", "--root", root, "removeWorkContainer", "/x")
            self.assertIn("start the helper: vitd_helper --root " + root, r.stderr)
            s = run("vitdctl", "status", "--root", root)
            self.assertEqual(s.returncode, 69, s.stdout)
            self.assertIn("down: No such file or directory", s.stdout)
            self.assertIn(root + "/private/var/logs/vitd/vitd_helper-", s.stdout)

    def test_the_helpers_command_line(self):
        self.assertRegex(run("vitd_helper", "--version").stdout, r"^vitd_helper \(vitd\) \S+\n$")
        self.assertIn("--version", run("vitd_helper", "--help").stdout)
        for args in (["--bogus"], ["extra"], ["--root"]):
            self.assertEqual(run("vitd_helper", *args).returncode, 64, args)


if __name__ == "__main__":
    BIN = sys.argv.pop(1)
    unittest.main()
