#!/usr/bin/env python3
"""Drives vtr-manifest on trees made here and checks what it writes against an
independent reading of the same tree: plistlib for the file, os.lstat,
os.listxattr, hashlib.sha1 and os.readlink for the items, pwd and grp for the
account names."""
import datetime
import grp
import hashlib
import json
import os
import plistlib
import pwd
import shutil
import socket
import stat
import subprocess
import sys
import tempfile
import unittest

BIN = None
EPOCH_2001 = datetime.datetime(2001, 1, 1)

TYPES = {
    stat.S_IFREG: "NSFileTypeRegular",
    stat.S_IFDIR: "NSFileTypeDirectory",
    stat.S_IFLNK: "NSFileTypeSymbolicLink",
}


def run(*args, timeout=120, cwd=None, **options):
    return subprocess.run([os.path.join(BIN, "vtr-manifest"), *args], capture_output=True, timeout=timeout, cwd=cwd,
                          **options)


def make_tree(root):
    """Every kind of item a client can plant: files around the 256 KiB read
    size, extended attributes, links of all sorts, a fifo and a socket,
    hidden and non-ASCII names, odd modes and owners."""
    os.makedirs(os.path.join(root, "dir/sub/deeper"))
    os.makedirs(os.path.join(root, ".hidden"))
    sizes = {"empty": 0, "small": 10, "chunk": 262144, "chunk+1": 262145, "big": 3 << 20}
    for name, size in sizes.items():
        with open(os.path.join(root, "dir", name), "wb") as f:
            f.write(os.urandom(size))
    with open(os.path.join(root, "dir/sub/deeper/caf\u00e9 \u2603.txt"), "w") as f:
        f.write("snow")
    with open(os.path.join(root, ".hidden/.profile"), "w") as f:
        f.write("x")
    tagged = os.path.join(root, "dir/small")
    os.setxattr(tagged, "user.one", b"\x00\x01binary")
    os.setxattr(tagged, "user.empty", b"")
    os.setxattr(os.path.join(root, "dir/sub"), "user.on-a-dir", b"d")
    os.symlink("small", os.path.join(root, "dir/link-to-file"))
    os.symlink("/etc", os.path.join(root, "dir/link-to-etc"))
    os.symlink("../nowhere", os.path.join(root, "dir/dangling"))
    os.symlink("sub", os.path.join(root, "dir/link-to-dir"))
    os.mkfifo(os.path.join(root, "dir/fifo"))
    with socket.socket(socket.AF_UNIX) as s:
        s.bind(os.path.join(root, "dir/sock"))
    os.chmod(os.path.join(root, "dir/chunk"), 0o4751)
    if os.geteuid() == 0:
        os.chown(os.path.join(root, "dir/empty"), 65534, 65534)
        os.chown(os.path.join(root, "dir/big"), 54321, 54321)  # ids without names
        os.link(os.path.join(root, "dir/big"), os.path.join(root, "hardlink"))


def expected_keys(root, inclusive):
    keys = {"/"} if inclusive else set()
    for dirpath, dirnames, filenames in os.walk(root):
        for name in dirnames + filenames:
            path = os.path.join(dirpath, name)
            if stat.S_IFMT(os.lstat(path).st_mode) in TYPES:
                keys.add(path[len(root):])
    return keys


def seconds_since_2001(value):
    return (value - EPOCH_2001).total_seconds()


class CreateTest(unittest.TestCase):
    def setUp(self):
        self.tmp = tempfile.mkdtemp()
        self.root = os.path.join(self.tmp, "tree")
        make_tree(self.root)
        self.out = os.path.join(self.tmp, "manifest.plist")

    def tearDown(self):
        shutil.rmtree(self.tmp)

    def create(self, *extra):
        result = run("create", self.root, "-o", self.out, *extra)
        self.assertEqual(result.returncode, 0, result.stderr)
        with open(self.out, "rb") as f:
            return plistlib.load(f), result.stderr.decode()

    def check_record(self, key, record):
        path = self.root + ("" if key == "/" else key)
        st = os.lstat(path)
        attributes = record["VTRManifestFileAttributes"]
        self.assertEqual(attributes["NSFileType"], TYPES[stat.S_IFMT(st.st_mode)])
        self.assertEqual(attributes["NSFilePosixPermissions"], st.st_mode & 0o7777)
        self.assertEqual(attributes["NSFileSize"], st.st_size)
        self.assertEqual(attributes["NSFileReferenceCount"], st.st_nlink)
        self.assertEqual(attributes["NSFileSystemFileNumber"], st.st_ino)
        self.assertEqual(attributes["NSFileOwnerAccountID"], st.st_uid)
        self.assertEqual(attributes["NSFileGroupOwnerAccountID"], st.st_gid)
        try:
            self.assertEqual(attributes["NSFileOwnerAccountName"], pwd.getpwuid(st.st_uid).pw_name)
        except KeyError:
            self.assertNotIn("NSFileOwnerAccountName", attributes)
        try:
            self.assertEqual(attributes["NSFileGroupOwnerAccountName"], grp.getgrgid(st.st_gid).gr_name)
        except KeyError:
            self.assertNotIn("NSFileGroupOwnerAccountName", attributes)
        mtime = seconds_since_2001(attributes["NSFileModificationDate"]) + 978307200
        self.assertAlmostEqual(mtime, st.st_mtime_ns / 1e9, delta=1e-5)

        xattrs = {n: os.getxattr(path, n, follow_symlinks=False) for n in os.listxattr(path, follow_symlinks=False)}
        self.assertEqual(record["VTRManifestFileExtendedAttributes"], xattrs)
        if stat.S_ISREG(st.st_mode):
            with open(path, "rb") as f:
                self.assertEqual(record["VTRManifestFileHash"], hashlib.sha1(f.read()).digest())
        else:
            self.assertEqual(record["VTRManifestFileHash"], b"")
        target = os.readlink(path) if stat.S_ISLNK(st.st_mode) else ""
        self.assertEqual(record["VTRManifestSymbolicLinkTargetFile"], target)

    def test_every_entry_matches_the_tree(self):
        manifest, stderr = self.create("--inclusive")
        self.assertEqual(set(manifest), expected_keys(self.root, inclusive=True))
        for key, record in manifest.items():
            with self.subTest(key=key):
                self.check_record(key, record)
        self.assertEqual(stderr, "")  # the model's log lines only with --verbose
        _, stderr = self.create("--verbose")
        for special in ("fifo", "sock"):
            self.assertIn(os.path.join(self.root, "dir", special) + " is special file. Leave it along", stderr)

    def test_every_spelling_of_the_tree_gives_the_same_keys(self):
        for name in ("tree", "x.tree.y", "README.gz", "tt"):  # names that hold the tree's name, and dots
            with open(os.path.join(self.root, name), "w") as f:
                f.write(name)
        os.symlink(self.root, os.path.join(self.tmp, "link"))
        expected = expected_keys(self.root, inclusive=False)
        spellings = [(self.root, None), ("tree", self.tmp), ("./tree/", self.tmp), ("tree//.", self.tmp),
                     (".", self.root), ("link", self.tmp), (os.path.join(self.tmp, "link") + "/", None)]
        for spelling, cwd in spellings:
            with self.subTest(spelling=spelling):
                result = run("create", spelling, "-o", self.out, cwd=cwd)
                self.assertEqual(result.returncode, 0, result.stderr)
                with open(self.out, "rb") as f:
                    self.assertEqual(set(plistlib.load(f)), expected)
                # An unchanged tree compares equal in any other spelling.
                other = spellings[(spellings.index((spelling, cwd)) + 3) % len(spellings)]
                compared = run("compare", self.out, other[0], cwd=other[1])
                self.assertEqual((compared.returncode, compared.stdout), (0, b""), compared.stderr)
        # A manifest written inside the tree, named relatively: the same keys,
        # and it compares equal to the tree that now holds it.
        result = run("create", ".", "-o", "m.plist", "--skip", "dir", cwd=self.root)
        self.assertEqual(result.returncode, 0, result.stderr)
        with open(os.path.join(self.root, "m.plist"), "rb") as f:
            self.assertEqual(set(plistlib.load(f)), {k for k in expected if not k.startswith("/dir")})
        compared = run("compare", "m.plist", ".", "--skip", "dir", cwd=self.root)
        self.assertEqual(compared.returncode, 0, compared.stdout)

    def test_names_that_are_not_utf8_fail_and_are_named(self):
        manifest, _ = self.create()
        os.mknod(os.path.join(self.root.encode(), b"dir/bad\xff name"))
        for args in (["create", self.root, "-o", self.out], ["compare", self.out, self.root]):
            with self.subTest(command=args[0]):
                result = run(*args)
                self.assertEqual(result.returncode, 65, result.stderr)
                self.assertIn(b"/dir/bad\\xff name: ", result.stderr)
                with open(self.out, "rb") as f:
                    self.assertEqual(plistlib.load(f), manifest)  # left as it was
        result = run("create", self.root, "-o", "-", "--skip", b"dir/bad\xff name", cwd=self.tmp)
        self.assertEqual(set(plistlib.loads(result.stdout)), set(manifest))
        self.assertFalse(os.path.exists(os.path.join(self.tmp, "-")))

    def test_a_file_that_cannot_be_read_fails_and_is_named(self):
        tree = os.path.join(self.tmp, "closed-tree")
        os.makedirs(tree)
        with open(os.path.join(tree, "closed"), "w") as f:
            f.write("content")
        manifest = os.path.join(tree, "m.plist")
        self.assertEqual(run("create", tree, "-o", manifest).returncode, 0)
        os.chmod(os.path.join(tree, "closed"), 0)
        # Root reads any file: the tool then runs as nobody, who may enter.
        as_nobody = {"preexec_fn": lambda: os.setuid(65534)} if os.geteuid() == 0 else {}
        for path in (self.tmp, tree):
            os.chmod(path, 0o755)
        for args in (["create", tree, "-o", "-"], ["compare", manifest, tree]):
            with self.subTest(command=args[0]):
                result = run(*args, env={**os.environ, "TMPDIR": "/tmp"}, **as_nobody)
                self.assertEqual(result.returncode, 74, result.stderr)
                self.assertIn(b"cannot read " + tree.encode() + b"/closed: its content cannot be read", result.stderr)
                self.assertEqual(result.stdout, b"")

    def test_keys_relative_to_another_root_and_skips(self):
        manifest, _ = self.create("--relative-to", self.tmp, "--skip", "dir/sub", "--skip", os.path.join(self.root, "di"),
                                  "--skip", os.path.relpath(os.path.join(self.root, ".hidden")))  # from here
        keys = set(manifest)
        self.assertIn("/tree/dir/small", keys)
        self.assertNotIn("/tree/dir/sub", keys)
        self.assertFalse(any(k.startswith("/tree/dir/sub/") for k in keys))
        self.assertIn("/tree/dir/link-to-dir", keys)
        self.assertNotIn("/tree/.hidden", keys)

    def test_sequential_and_parallel_files_are_identical(self):
        self.create("--jobs", "0")
        with open(self.out, "rb") as f:
            sequential = f.read()
        self.create("--jobs", "4")
        with open(self.out, "rb") as f:
            self.assertEqual(f.read(), sequential)

    def test_deep_nesting_is_reported_not_followed_forever(self):
        fd = os.open(self.root, os.O_RDONLY)
        try:
            for _ in range(700):
                os.mkdir("n", dir_fd=fd)
                next_fd = os.open("n", os.O_RDONLY, dir_fd=fd)
                os.close(fd)
                fd = next_fd
        finally:
            os.close(fd)
        result = run("create", self.root, "-o", self.out)
        self.assertEqual(result.returncode, 74)
        self.assertIn(b"nested more than 512 levels deep; not entered", result.stderr)
        self.assertFalse(os.path.exists(self.out))  # never a manifest with a part left out

    def test_unwritable_output_fails_and_writes_nothing(self):
        result = run("create", self.root, "-o", os.path.join(self.tmp, "absent", "m.plist"))
        self.assertEqual(result.returncode, 74)
        self.assertFalse(os.path.exists(os.path.join(self.tmp, "absent")))

    def test_bad_input_is_an_error_never_an_empty_manifest(self):
        out = os.path.join(self.tmp, "m.plist")
        a_file = os.path.join(self.root, "plain")
        with open(a_file, "w") as f:
            f.write("x")
        cases = (
            (["create", os.path.join(self.tmp, "missing"), "-o", out], 66, "No such file or directory"),
            (["create", a_file, "-o", out], 65, "is not a directory: a manifest describes a tree"),
            (["create", self.root, "--relative-to", os.path.join(self.tmp, "elsewhere"), "-o", out], 64,
             "must be " + self.root + " or a folder above it"),
            (["create", self.root, "--skip", self.tmp, "-o", out], 64, "does not lie inside"),
            (["create", self.root, "--skip", self.root + "/", "-o", out], 64, "does not lie inside"),
            (["compare", a_file, os.path.join(self.tmp, "missing")], 66, "No such file or directory"),
        )
        for args, status, message in cases:
            with self.subTest(args=args):
                result = run(*args)
                self.assertEqual(result.returncode, status, result.stderr)
                self.assertIn(message, result.stderr.decode())
                self.assertFalse(os.path.exists(out))
        # A folder above the tree, and a skip inside it, are fine.
        self.assertEqual(run("create", self.root, "--relative-to", self.tmp, "--skip", a_file, "-o", out).returncode, 0)
        # A property list that is not a manifest is refused where one is read.
        other = os.path.join(self.tmp, "other.plist")
        with open(other, "wb") as f:
            plistlib.dump({"DemoMode": True}, f)
        for args in (["show", other], ["compare", other, self.root]):
            result = run(*args)
            self.assertEqual(result.returncode, 65, args)
            self.assertIn(b"is not a manifest", result.stderr)
        self.assertRegex(run("--version").stdout.decode(), r"^vtr-manifest \(vitd\) \d+\.\d+\n$")


class ShowAndCompareTest(unittest.TestCase):
    def setUp(self):
        self.tmp = tempfile.mkdtemp()
        self.root = os.path.join(self.tmp, "tree")
        make_tree(self.root)
        self.out = os.path.join(self.tmp, "manifest.plist")
        result = run("create", self.root, "-o", self.out)
        self.assertEqual(result.returncode, 0, result.stderr)
        with open(self.out, "rb") as f:
            self.manifest = plistlib.load(f)

    def tearDown(self):
        shutil.rmtree(self.tmp)

    def compare(self):
        result = run("compare", self.out, self.root)
        return result.returncode, sorted(result.stdout.decode().splitlines())

    def test_text_and_json_show_every_entry(self):
        text = run("show", self.out)
        self.assertEqual(text.returncode, 0)
        lines = text.stdout.decode().splitlines()
        self.assertEqual(len(lines), len(self.manifest))
        small = self.manifest["/dir/small"]
        small_line = next(l for l in lines if l.endswith(" /dir/small xattrs=user.empty,user.one"))
        self.assertTrue(small_line.startswith("- 0644 "))
        self.assertIn(small["VTRManifestFileHash"].hex(), small_line)
        self.assertTrue(any(l.startswith("l ") and l.endswith("/dir/link-to-etc -> /etc") for l in lines))

        shown = json.loads(run("show", self.out, "--format", "json").stdout)
        self.assertEqual(set(shown), set(self.manifest))
        self.assertEqual(shown["/dir/small"]["VTRManifestFileHash"], small["VTRManifestFileHash"].hex())
        self.assertEqual(shown["/dir/small"]["VTRManifestFileExtendedAttributes"]["user.one"], "0001" + b"binary".hex())

        # XML carries dates to the whole second.
        one = run("show", self.out, "--format", "xml", "--path", "/dir/small")
        whole = {k: v.replace(microsecond=0) if isinstance(v, datetime.datetime) else v
                 for k, v in small["VTRManifestFileAttributes"].items()}
        self.assertEqual(plistlib.loads(one.stdout), {"/dir/small": dict(small, VTRManifestFileAttributes=whole)})
        self.assertEqual(run("show", self.out, "--path", "/absent").returncode, 1)

    def test_a_signed_manifests_payload_is_shown(self):
        payload = {"Version": 3, "Info": {}, "App": [], "Backup": self.manifest,
                   "AppData": {"com.example.app": {"Manifest": {"/Documents": self.manifest["/dir"]}}}}
        signed = {"Version": 2, "Certificate": [b"not checked"], "Signature": b"",
                  "Payload": plistlib.dumps(payload, fmt=plistlib.FMT_BINARY)}
        path = os.path.join(self.tmp, "signed.plist")
        with open(path, "wb") as f:
            plistlib.dump(signed, f)
        self.assertEqual(run("show", path).stdout, run("show", self.out).stdout)
        app = run("show", path, "--container", "com.example.app").stdout.decode().splitlines()
        self.assertEqual(len(app), 1)
        self.assertTrue(app[0].endswith(" /Documents"))
        self.assertEqual(run("show", path, "--container", "unknown").returncode, 65)

    def test_compare_names_each_difference(self):
        self.assertEqual(self.compare(), (0, []))
        r = self.root
        with open(os.path.join(r, "dir/small"), "ab") as f:
            f.write(b"more")
        os.chmod(os.path.join(r, "dir/empty"), 0o600)
        os.setxattr(os.path.join(r, "dir/sub"), "user.on-a-dir", b"changed")
        os.remove(os.path.join(r, "dir/link-to-file"))
        os.symlink("elsewhere", os.path.join(r, "dir/link-to-file"))
        os.remove(os.path.join(r, "dir/chunk"))
        os.mkdir(os.path.join(r, "dir/chunk"))
        os.remove(os.path.join(r, "dir/big"))
        with open(os.path.join(r, "new"), "w") as f:
            f.write("")
        os.setxattr(os.path.join(r, "dir/empty"), "user.added", b"")
        os.utime(os.path.join(r, "dir/sub/deeper"), ns=(0, 1_500_000_000_123_456_000))
        result = run("compare", self.out, r, "--json")
        self.assertEqual(result.returncode, 1)
        document = json.loads(result.stdout)
        self.assertFalse(document["matches"])
        found = {d["path"]: (d["status"], {c["key"]: (c["expected"], c["found"]) for c in d.get("changes", [])})
                 for d in document["differences"]}
        small = self.manifest["/dir/small"]
        self.assertEqual(found["/new"], ("extra", {}))
        self.assertEqual(found["/dir/big"], ("missing", {}))
        self.assertEqual(found["/dir/chunk"][1]["type"], ("NSFileTypeRegular", "NSFileTypeDirectory"))
        self.assertEqual(found["/dir/small"][1]["size"], (10, 14))
        self.assertEqual(found["/dir/small"][1]["digest"][0], small["VTRManifestFileHash"].hex())
        self.assertEqual(found["/dir/link-to-file"][1]["link target"], ("small", "elsewhere"))
        self.assertEqual(found["/dir/empty"][1]["mode"], ("0644", "0600"))
        self.assertEqual(found["/dir/empty"][1]["xattrs"], ([], ["user.added"]))
        self.assertIn("xattr user.on-a-dir", found["/dir/sub"][1])
        self.assertEqual(found["/dir/sub/deeper"], ("changed", {"modification time": (
            found["/dir/sub/deeper"][1]["modification time"][0], "2017-07-14T02:40:00.123456Z")}))
        # The same as text, a path and then each key with both values.
        lines = run("compare", self.out, r).stdout.decode().splitlines()
        self.assertIn("/dir/small changed", lines)
        self.assertIn("\tsize expected 10, found 14", lines)
        self.assertIn("/new extra", lines)
        self.assertIn("/dir/big missing", lines)

    def test_usage_errors(self):
        for args in ([], ["frobnicate"], ["create", self.root], ["show"], ["show", self.out, "--format", "yaml"],
                     ["compare", self.out], ["create", self.root, "-o", self.out, "--jobs", "many"],
                     ["show", self.out, "--skip", "/x"]):
            with self.subTest(args=args):
                self.assertEqual(run(*args).returncode, 64)
        self.assertEqual(run("--help").returncode, 0)


def make_pki(folder, name):
    """A SHA-1 signed root in folder/NAME-anchors and a signer it issued;
    returns (anchors folder, signer key, signer certificate)."""
    quiet = {"check": True, "capture_output": True}
    anchors = os.path.join(folder, name + "-anchors")
    os.makedirs(anchors)
    root_key, root = os.path.join(folder, name + "-root.key"), os.path.join(anchors, "root.pem")
    key, csr, cert = (os.path.join(folder, name + suffix) for suffix in (".key", ".csr", ".pem"))
    subprocess.run(["openssl", "req", "-x509", "-newkey", "rsa:2048", "-nodes", "-sha1", "-days", "2", "-subj",
                    f"/CN={name} root", "-keyout", root_key, "-out", root], **quiet)
    subprocess.run(["openssl", "req", "-newkey", "rsa:2048", "-nodes", "-subj", f"/CN={name} signer", "-keyout", key,
                    "-out", csr], **quiet)
    subprocess.run(["openssl", "x509", "-req", "-sha1", "-days", "1", "-in", csr, "-CA", root, "-CAkey", root_key,
                    "-CAcreateserial", "-out", cert], **quiet)
    return anchors, key, cert


class SignedManifestTest(unittest.TestCase):
    """sign, verify and inspect against a throwaway PKI made here."""

    @classmethod
    def setUpClass(cls):
        cls.tmp = tempfile.mkdtemp()
        cls.root = os.path.join(cls.tmp, "tree")
        make_tree(cls.root)
        cls.manifest = os.path.join(cls.tmp, "manifest.plist")
        subprocess.run([os.path.join(BIN, "vtr-manifest"), "create", cls.root, "-o", cls.manifest], check=True)
        cls.anchors, cls.key, cls.cert = make_pki(cls.tmp, "tool")
        cls.other_anchors, _, _ = make_pki(cls.tmp, "other")
        cls.efivars = os.path.join(cls.tmp, "efivars")  # no Secure Boot answer: never the host's
        os.makedirs(cls.efivars)

    @classmethod
    def tearDownClass(cls):
        shutil.rmtree(cls.tmp)

    def sign(self, name, *extra):
        out = os.path.join(self.tmp, name)
        result = run("sign", self.manifest, "--key", self.key, "--certificate", self.cert, "-o", out, *extra)
        self.assertEqual(result.returncode, 0, result.stderr)
        return out

    def verify(self, path, anchors=None, *options):
        return run("verify", path, "--anchors", anchors or self.anchors, "--test-anchors",
                   os.path.join(self.tmp, "none"), "--efivars", self.efivars, *options)

    def rewritten(self, path, name, change):
        """A copy of the signed manifest at path with change applied to its
        outer dictionary."""
        with open(path, "rb") as f:
            outer = plistlib.load(f)
        change(outer)
        out = os.path.join(self.tmp, name)
        with open(out, "wb") as f:
            plistlib.dump(outer, f, fmt=plistlib.FMT_BINARY)
        return out

    def test_a_signed_manifest_holds_its_manifests_and_verifies(self):
        with open(self.manifest, "rb") as f:
            records = plistlib.load(f)
        for name, extra in (("binary.plist", []), ("xml.plist", ["--xml"])):
            with self.subTest(name=name):
                signed = self.sign(name, "--app-data", f"com.example.app={self.manifest}", "--group-data",
                                   f"group.example={self.manifest}", "--payload-version", "4", "--info", "a demo", *extra)
                with open(signed, "rb") as f:
                    self.assertEqual(f.read(6) == b"<?xml ", bool(extra))
                with open(signed, "rb") as f:
                    outer = plistlib.load(f)
                payload = plistlib.loads(outer["Payload"])
                self.assertEqual(outer["Version"], 2)
                self.assertEqual(payload["Version"], 4)
                # XML carries dates to the whole second only.
                expected = records if not extra else plistlib.loads(plistlib.dumps(records))
                self.assertEqual(payload["Backup"], expected)
                self.assertEqual(payload["AppData"], {"com.example.app": {"Manifest": expected}})
                self.assertEqual(payload["GroupData"], {"group.example": expected})
                self.assertNotIn("ExtensionData", payload)
                result = self.verify(signed)
                self.assertEqual(result.returncode, 0, result.stderr)
                self.assertIn(f"{len(records)} records", result.stdout.decode())
                self.assertEqual(result.stderr, b"")
                self.assertIn(b"Manifest passed signature check.", self.verify(signed, None, "--verbose").stderr)
                verdict = json.loads(self.verify(signed, None, "--json").stdout)
                self.assertEqual((verdict["trusted"], verdict["cause"], verdict["records"]), (True, None, len(records)))
                # The signed manifest shows and compares as the manifest it holds.
                self.assertEqual(run("show", signed).stdout, run("show", self.manifest).stdout)
                self.assertEqual(run("compare", signed, self.root).returncode, 0)

    def test_verify_answers_by_cause(self):
        signed = self.sign("causes.plist")

        def flip(outer):
            payload = bytearray(outer["Payload"])
            payload[len(payload) // 2] ^= 1
            outer["Payload"] = bytes(payload)

        cases = [
            ("another root", signed, self.other_anchors, 5, "no trusted root vouches for its certificates"),
            ("a flipped payload byte", self.rewritten(signed, "flipped.plist", flip), None, 6,
             "the signature does not sign the payload"),
            ("outer version 3", self.rewritten(signed, "v3.plist", lambda o: o.update(Version=3)), None, 4,
             "its version is not supported"),
            ("no certificates", self.rewritten(signed, "nocert.plist", lambda o: o.pop("Certificate")), None, 3,
             "is not a well-formed signed manifest"),
            ("not a property list", self.manifest + ".missing", None, 66, "No such file"),
            ("no anchors folder", signed, os.path.join(self.tmp, "absent"), 66,
             "trust anchors folder " + os.path.join(self.tmp, "absent") + ": No such file or directory"),
            ("no folder above it", signed, os.path.join(self.tmp, "absent", "anchors"), 66,
             os.path.join(self.tmp, "absent") + ": No such file or directory"),
        ]
        garbage = os.path.join(self.tmp, "garbage.plist")
        with open(garbage, "wb") as f:
            f.write(b"bplist00 not really")
        cases.append(("garbage", garbage, None, 3, "is not a well-formed signed manifest"))
        for name, path, anchors, status, message in cases:
            with self.subTest(name=name):
                result = self.verify(path, anchors)
                self.assertEqual(result.returncode, status, result.stderr)
                self.assertIn(message, result.stderr.decode())
                self.assertNotIn(b"-[VTR", result.stderr)
                if status in (3, 4, 5, 6):  # a verdict, also as JSON
                    verdict = json.loads(self.verify(path, anchors, "--json").stdout)
                    self.assertEqual((verdict["file"], verdict["trusted"]), (path, False))
                    self.assertTrue(verdict["cause"])

    def test_inspect_shows_the_outer_fields_and_the_payload(self):
        signed = self.sign("inspect.plist", "--app-data", f"com.example.app={self.manifest}", "--info", "shown")
        result = run("inspect", signed, "--json")
        self.assertEqual(result.returncode, 0, result.stderr)
        description = json.loads(result.stdout)
        self.assertEqual(description["version"], 2)
        [certificate] = description["certificates"]
        self.assertEqual(certificate["subject"], "CN=tool signer")
        self.assertEqual(certificate["issuer"], "CN=tool root")
        self.assertRegex(certificate["notAfter"], r"^\d{4}-\d\d-\d\dT\d\d:\d\d:\d\dZ$")
        with open(self.manifest, "rb") as f:
            count = len(plistlib.load(f))
        self.assertEqual(description["payload"]["records"], count)
        self.assertEqual(description["payload"]["appData"], {"com.example.app": count})
        self.assertEqual(description["payload"]["info"], {"Description": "shown"})
        text = run("inspect", signed).stdout.decode()
        self.assertIn("certificate 0: CN=tool signer", text)
        self.assertIn(f"appData com.example.app: {count} records", text)
        self.assertEqual(run("inspect", self.manifest).returncode, 65)

    def test_sign_refuses_what_it_cannot_use(self):
        signed = self.sign("refuse.plist")
        other_key = os.path.join(self.tmp, "other.key")  # made with the other PKI's signer
        for args in (["--key", self.cert, "--certificate", self.cert],                # no private key
                     ["--key", self.key, "--certificate", self.key],                  # no certificate
                     ["--key", other_key, "--certificate", self.cert],               # not the certificate's key
                     ["--key", self.key, "--certificate", self.cert, "--app-data", f"a={signed}"]):  # signed
            with self.subTest(args=args):
                result = run("sign", self.manifest, "-o", os.path.join(self.tmp, "never.plist"), *args)
                self.assertEqual(result.returncode, 65, result.stderr)
                self.assertFalse(os.path.exists(os.path.join(self.tmp, "never.plist")))
        with open(signed, "rb") as f:
            self.assertEqual(run("sign", self.manifest, "--key", self.key, "--certificate", self.cert, "-o", "-")
                             .stdout[:8], f.read(8))
        for args in (["sign", self.manifest, "-o", "x"], ["sign", self.manifest, "--key", self.key, "-o", "x"],
                     ["sign", self.manifest, "--key", self.key, "--certificate", self.cert, "-o", "x",
                      "--app-data", "no-equals"],
                     ["sign", self.manifest, "--key", self.key, "--certificate", self.cert, "-o", "x",
                      "--payload-version", "5"]):
            with self.subTest(args=args):
                self.assertEqual(run(*args).returncode, 64)


if __name__ == "__main__":
    BIN = sys.argv.pop(1)
    unittest.main()
