#!/usr/bin/env python3
"""Checks a device manifest against the tree it describes, independently of
the helper's own code: plistlib reads the file; os.lstat, os.listxattr,
os.readlink and hashlib.sha1 read the tree.

usage: check_manifest.py MANIFEST HOST_ROOT SCAN_ROOT RELATIVE_TO
                         [--skip PATH]... [--ignore PATH]...

HOST_ROOT is where the helper's "/" is on this machine (its sandbox root);
SCAN_ROOT and RELATIVE_TO are paths as the helper saw them. Items under a
--skip path must not be in the manifest; items under an --ignore path (files
that change while the helper runs, such as its log) are not checked. Prints
one line per difference and exits 1 when there is any.
"""
import argparse
import hashlib
import os
import plistlib
import stat
import sys

TYPES = {stat.S_IFREG: "NSFileTypeRegular", stat.S_IFDIR: "NSFileTypeDirectory",
         stat.S_IFLNK: "NSFileTypeSymbolicLink"}


def accounts(path):
    names = {}
    with open(path) as f:
        for line in f:
            fields = line.strip().split(":")
            if len(fields) >= 3:
                names[int(fields[2])] = fields[0]
    return names


def main():
    parser = argparse.ArgumentParser()
    for name in ("manifest", "host_root", "scan_root", "relative_to"):
        parser.add_argument(name)
    parser.add_argument("--skip", action="append", default=[])
    parser.add_argument("--ignore", action="append", default=[])
    args = parser.parse_args()
    manifest_path, host_root, scan_root, relative_to = (args.manifest, args.host_root, args.scan_root,
                                                        args.relative_to)
    under = lambda inside, paths: any(inside == p or inside.startswith(p + "/") for p in paths)
    with open(manifest_path, "rb") as f:
        manifest = plistlib.load(f)
    users = accounts(os.path.join(host_root, "etc/passwd"))
    groups = accounts(os.path.join(host_root, "etc/group"))

    expected = {}
    for directory, dirs, files in os.walk(host_root + scan_root):
        for name in dirs + files:
            inside = os.path.join(directory, name)[len(host_root):]
            if under(inside, args.skip):
                continue
            st = os.lstat(host_root + inside)
            if stat.S_IFMT(st.st_mode) in TYPES:
                expected[inside[len(relative_to):]] = inside

    ignored = {key for key, inside in expected.items() if under(inside, args.ignore)}
    manifest = {key: entry for key, entry in manifest.items() if key not in ignored}
    expected = {key: inside for key, inside in expected.items() if key not in ignored}
    problems = []
    if set(manifest) != set(expected):
        problems.append("keys differ: only in manifest %s, only on disk %s"
                        % (sorted(set(manifest) - set(expected))[:5], sorted(set(expected) - set(manifest))[:5]))
    for key, inside in sorted(expected.items()):
        if key not in manifest:
            continue
        host = host_root + inside
        entry = manifest[key]
        st = os.lstat(host)
        attrs = entry["VTRManifestFileAttributes"]
        kind = TYPES[stat.S_IFMT(st.st_mode)]
        checks = [
            ("NSFileType", attrs.get("NSFileType"), kind),
            ("NSFilePosixPermissions", attrs.get("NSFilePosixPermissions"), st.st_mode & 0o7777),
            ("NSFileOwnerAccountID", attrs.get("NSFileOwnerAccountID"), st.st_uid),
            ("NSFileGroupOwnerAccountID", attrs.get("NSFileGroupOwnerAccountID"), st.st_gid),
            ("NSFileOwnerAccountName", attrs.get("NSFileOwnerAccountName"), users.get(st.st_uid)),
            ("NSFileGroupOwnerAccountName", attrs.get("NSFileGroupOwnerAccountName"), groups.get(st.st_gid)),
            ("NSFileSize", attrs.get("NSFileSize"), st.st_size),
            ("NSFileSystemFileNumber", attrs.get("NSFileSystemFileNumber"), st.st_ino),
            ("NSFileReferenceCount", attrs.get("NSFileReferenceCount"), st.st_nlink),
        ]
        if kind == "NSFileTypeRegular":
            with open(host, "rb") as f:
                digest = hashlib.sha1(f.read()).digest()
        else:
            digest = b""
        checks.append(("VTRManifestFileHash", entry.get("VTRManifestFileHash"), digest))
        target = os.readlink(host) if kind == "NSFileTypeSymbolicLink" else ""
        checks.append(("VTRManifestSymbolicLinkTargetFile", entry.get("VTRManifestSymbolicLinkTargetFile"), target))
        xattrs = {n: os.getxattr(host, n, follow_symlinks=False) for n in os.listxattr(host, follow_symlinks=False)}
        checks.append(("VTRManifestFileExtendedAttributes", entry.get("VTRManifestFileExtendedAttributes"), xattrs))
        for name, got, want in checks:
            if got != want:
                problems.append("%s %s: manifest %r, disk %r" % (key, name, got, want))
    for p in problems:
        print(p)
    print("%d entries checked, %d differences" % (len(expected), len(problems)))
    return 1 if problems else 0


if __name__ == "__main__":
    sys.exit(main())
