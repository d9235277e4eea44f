#!/usr/bin/env python3
"""Drives zarnutil on sparse disk images and reads the header bytes it writes
independently (struct, zlib, uuid) to compare them with the layout."""
import json
import os
import struct
import subprocess
import sys
import tempfile
import unittest
import uuid
import zlib

BIN = None

CRC_KIND = bytes.fromhex("6a9088cf8afd630ae351e24887e0b98b")
HFS_PLUS = bytes.fromhex("48465300000011aaaa1100306543ecac")
GIB = 1 << 30
MIB = 1 << 20


def run(*args):
    return subprocess.run([os.path.join(BIN, "zarnutil"), *args], capture_output=True, text=True)


def read_at(path, offset, length=4096):
    with open(path, "rb") as f:
        f.seek(offset)
        return f.read(length)


def write_at(path, offset, data):
    with open(path, "r+b") as f:
        f.seek(offset)
        f.write(data)


def crc_of(header):
    return zlib.crc32(header[:44] + b"\0\0\0\0" + header[48:])


def restamp(header):
    header = bytearray(header)
    struct.pack_into("<I", header, 44, crc_of(bytes(header)))
    return bytes(header)


class ZarnutilTest(unittest.TestCase):
    def setUp(self):
        self.dir = tempfile.TemporaryDirectory()
        self.image = os.path.join(self.dir.name, "disk.img")
        with open(self.image, "wb") as f:
            f.truncate(16 * GIB)

    def tearDown(self):
        self.dir.cleanup()

    def create(self, *options):
        result = run(*options, "create", self.image)
        self.assertEqual(result.returncode, 0, result.stderr)
        return read_at(self.image, 0)

    def test_create_writes_the_prescribed_header_twice(self):
        h = self.create()
        self.assertEqual(h[0:16], CRC_KIND)
        self.assertNotEqual(h[16:32], bytes(16))
        media, count, crc, flags = struct.unpack_from("<QIIQ", h, 32)
        self.assertEqual((media, count, flags), (16 * GIB, 1, 0))
        self.assertEqual(crc, crc_of(h))
        self.assertEqual(h[56:512], bytes(456))
        entry = h[512:640]
        self.assertEqual(entry[0:16], HFS_PLUS)
        self.assertNotIn(entry[16:32], (bytes(16), h[16:32]))
        begin, end, attributes = struct.unpack_from("<QQQ", entry, 32)
        self.assertEqual((begin, end, attributes), (24576, 24576 + 1016 * 16 * MIB, 0))
        self.assertEqual(entry[56:128], "Zarn".encode("utf-16-le") + bytes(64))
        self.assertEqual(h[640:2048], bytes(1408))
        chunk_map = struct.unpack_from("<1024H", h, 2048)
        self.assertEqual(chunk_map[0], 0xF000)
        self.assertEqual(list(chunk_map[1:1017]), list(range(1016)))
        self.assertEqual(set(chunk_map[1017:]), {0xF111})
        # The backup copy: the last block of chunk 0.
        self.assertEqual(read_at(self.image, 16 * MIB - 4096), h)

    def test_show_reads_back_what_create_wrote(self):
        h = self.create()
        result = run("show", self.image, "--json")
        self.assertEqual(result.returncode, 0, result.stderr)
        shown = json.loads(result.stdout)
        self.assertEqual(shown["media_size"], 16 * GIB)
        self.assertEqual(shown["media_identity"], str(uuid.UUID(bytes=h[16:32])))
        self.assertEqual(shown["partition_count"], 1)
        self.assertEqual(shown["crc"], struct.unpack_from("<I", h, 44)[0])
        self.assertEqual(shown["flags"], 0)
        self.assertEqual(shown["chunk_map"], list(struct.unpack_from("<1024H", h, 2048)))
        self.assertEqual(shown["partitions"], [{
            "index": 0, "type": "48465300-0000-11aa-aa11-00306543ecac",
            "identity": str(uuid.UUID(bytes=h[528:544])), "begin": 24576,
            "end": 24576 + 1016 * 16 * MIB, "attributes": 0, "name": "Zarn"}])
        text = run("show", self.image).stdout
        self.assertIn("media size:      17179869184 (16 GiB)", text)
        self.assertIn('"Zarn"', text)
        self.assertNotIn("chunk map:", text)
        self.assertIn("chunk map:", run("show", "--chunks", self.image).stdout)

    def test_damaged_copies_are_found_and_repaired(self):
        backup_at = 16 * MIB - 4096
        def inconsistent(h):  # a consistent CRC over a map that lost chunk 9, in both copies
            h = bytearray(h)
            struct.pack_into("<H", h, 2048 + 2 * 10, 0xF111)
            h = restamp(h)
            write_at(self.image, 0, h)
            write_at(self.image, backup_at, h)
        # name: (damage, check exit, the copies' conditions, repair exit, partitions left after it)
        cases = {
            "healthy": (lambda h: None, 0, ["sound", "sound"], 0, 1),
            "main destroyed": (lambda h: write_at(self.image, 0, os.urandom(4096)), 1, ["not-a-header", "sound"], 0, 1),
            "backup destroyed": (lambda h: write_at(self.image, backup_at, bytes(4096)), 1, ["sound", "not-a-header"],
                                 0, 1),
            "main crc": (lambda h: write_at(self.image, 100, b"\xff"), 1, ["bad-crc", "sound"], 0, 1),
            "backup differs": (lambda h: write_at(self.image, backup_at, restamp(h[:16] + os.urandom(16) + h[32:])),
                               1, ["sound", "sound"], 0, 1),
            "both destroyed": (lambda h: (write_at(self.image, 0, bytes(4096)), write_at(self.image, backup_at,
                                                                                          bytes(4096))),
                               65, ["not-a-header", "not-a-header"], 65, None),
            "map inconsistent": (inconsistent, 1, ["inconsistent", "inconsistent"], 1, 1),
        }
        self.create()
        self.assertEqual(run("repair", "--force", self.image).returncode, 0)  # a sound header is left alone
        self.assertEqual(struct.unpack_from("<I", read_at(self.image, 0), 40)[0], 1)
        for name, (damage, check_exit, conditions, repair_exit, partitions) in cases.items():
            with self.subTest(name):
                damage(self.create("--force"))
                before = read_at(self.image, 0), read_at(self.image, backup_at)
                check = run("check", "--json", self.image)
                self.assertEqual(check.returncode, check_exit, check.stderr)
                self.assertEqual([c["condition"] for c in json.loads(check.stdout)["copies"]], conditions)
                self.assertEqual(run("repair", "--dry-run", self.image).returncode, 65 if repair_exit == 65 else 0)
                repair = run("repair", self.image)
                self.assertEqual(repair.returncode, repair_exit, repair.stdout + repair.stderr)
                if repair_exit != 0:
                    self.assertEqual((read_at(self.image, 0), read_at(self.image, backup_at)), before)
                    continue
                self.assertEqual(read_at(self.image, 0), read_at(self.image, backup_at))
                self.assertEqual(run("check", self.image).returncode, 0)
                self.assertEqual(run("export", self.image).returncode, 0)
                self.assertEqual(struct.unpack_from("<I", read_at(self.image, 0), 40)[0], partitions)
        # The library's rules repair the inconsistent map by deleting the
        # partition: said in a few lines, and only with --force.
        self.assertIn("deletes partition 0 \"Zarn\" (", run("repair", "--dry-run", self.image).stdout)
        strict = run("repair", "--strict", "--force", self.image)
        self.assertEqual((strict.returncode, strict.stderr.splitlines()[:2]),
                         (1, ["zarn: partition 0 start/end not in order", "zarn: partition table corrupt"]))
        forced = run("repair", "--force", self.image)
        self.assertEqual(forced.returncode, 0, forced.stderr)
        self.assertLess(len((forced.stdout + forced.stderr).splitlines()), 6)
        repaired = read_at(self.image, 0)
        self.assertEqual(struct.unpack_from("<II", repaired, 40), (0, crc_of(repaired)))
        self.assertEqual(read_at(self.image, backup_at), repaired)

    def test_create_refuses_a_medium_too_small(self):
        for size in (0, MIB):
            with open(self.image, "wb") as f:
                f.truncate(size)
            result = run("create", self.image)
            self.assertEqual(result.returncode, 65, size)
            self.assertIn("zarnutil: ", result.stderr)
            self.assertEqual(os.path.getsize(self.image), size)

    def test_create_keeps_an_existing_header_unless_forced(self):
        h = self.create()
        result = run("create", self.image)
        self.assertEqual(result.returncode, 65)
        self.assertIn("a Zarn header is already there; --force replaces it", result.stderr)
        result = run("create", "--dry-run", "--force", self.image)
        self.assertEqual(result.returncode, 0, result.stderr)
        self.assertIn("would write a fresh header", result.stderr)
        self.assertEqual(read_at(self.image, 0), h)
        self.assertEqual(run("create", "--force", self.image).returncode, 0)
        self.assertNotEqual(read_at(self.image, 0), h)  # a new media identity

    def test_export_and_map(self):
        self.create()
        result = run("export", self.image, "--json")
        self.assertEqual(result.returncode, 0, result.stderr)
        exported = json.loads(result.stdout)
        self.assertEqual(set(exported), {"media_identity", "partitions"})
        (partition,) = exported["partitions"]
        self.assertEqual(set(partition), {"index", "name", "type", "identity", "size", "flags", "extents"})
        self.assertEqual(partition["extents"], [{"offset": 16 * MIB, "length": 1016 * 16 * MIB}])
        self.assertEqual(partition["size"], 1016 * 16 * MIB)

        lines = run("map", self.image).stdout.splitlines()
        grid = [line for line in lines if line.startswith("0x")]
        self.assertEqual(len(grid), 32)
        self.assertTrue(all(len(line.split()[1]) == 32 for line in grid))
        self.assertTrue(grid[0].endswith("#" + "A" * 31))
        self.assertTrue(grid[-1].endswith("A" * 25 + "." * 7))
        self.assertIn('A partition 0 "Zarn": 1016 chunks in 1 run', "\n".join(lines))
        self.assertIn("free: 7 chunks (112 MiB) in 1 run", lines)

    def test_hostile_names_stay_valid_json(self):
        h = bytearray(self.create())
        units = [ord('"'), ord("\\"), 0x01, 0xE9, 0xD800, ord("Z")]
        h[512 + 56:512 + 128] = struct.pack("<%dH" % len(units), *units).ljust(72, b"\0")
        h = restamp(h)
        write_at(self.image, 0, h)
        expected = '"\\\x01\u00e9\ufffd\ufffd\ufffdZ'
        for command in ("show", "export"):
            result = run(command, self.image, "--json")
            self.assertEqual(result.returncode, 0, result.stderr)
            self.assertEqual(json.loads(result.stdout)["partitions"][0]["name"], expected, command)
        self.assertIn('"\\"\\\\\\u0001', run("show", self.image).stdout)

    def test_block_sizes(self):
        h = self.create("--block-size", "16384")
        begin = struct.unpack_from("<Q", h, 512 + 32)[0]
        self.assertEqual(begin, 2 * 16384 + 16384)
        self.assertEqual(read_at(self.image, 16 * MIB - 16384), h)
        self.assertEqual(run("--block-size=16384", "check", self.image).returncode, 0)
        for size, message in (("4095", "zarn: media block size too small\n"),
                              ("16385", "zarn: media block size too large\n")):
            result = run("--block-size", size, "create", "--force", self.image)
            self.assertEqual((result.returncode, result.stderr), (65, message))

    def gpt_disk(self, entries, blocks=65536, signed=True):
        """A 4096-byte-block disk image with a GPT of entries (name, first, count) and both copies."""
        bs, first_usable, last_usable, disk_guid = 4096, 256, blocks - 3, uuid.uuid4().bytes_le
        table = b"".join(uuid.uuid4().bytes_le + uuid.uuid4().bytes_le + struct.pack("<QQQ", f, f + n - 1, 0) +
                         name.encode("utf-16-le").ljust(72, b"\0") for name, f, n in entries)
        def header(my, alternate, table_lba):
            h = bytearray(struct.pack("<8sIIIIQQQQ16sQIII", b"EFI PART", 0x10000, 92, 0, 0, my, alternate,
                                      first_usable, last_usable, disk_guid, table_lba, len(entries),
                                      128, zlib.crc32(table)))
            struct.pack_into("<I", h, 16, zlib.crc32(bytes(h)))
            return bytes(h)
        with open(self.image, "r+b") as f:
            f.truncate(blocks * bs)
            f.seek(440)
            f.write(b"nraZ" if signed else b"\0\0\0\0")
            for offset, data in ((bs, header(1, blocks - 1, 2)), (2 * bs, table), ((last_usable + 1) * bs, table),
                                 ((blocks - 1) * bs, header(blocks - 1, 1, last_usable + 1))):
                f.seek(offset)
                f.write(data)

    def test_disk_shows_what_the_resize_sees(self):
        self.gpt_disk([("System", 256, 4096), ("Data", 8448, 16384), ("Update", 4352, 4096)])
        result = run("disk", self.image, "--json")
        self.assertEqual(result.returncode, 0, result.stderr)
        disk = json.loads(result.stdout)
        self.assertTrue(disk["zarnSignature"])
        self.assertTrue(disk["gptValid"])
        self.assertEqual([(e["name"], e["first"], e["blocks"], e["data"]) for e in disk["entries"]],
                         [("System", 256, 4096, False), ("Data", 8448, 16384, True), ("Update", 4352, 4096, False)])
        self.assertEqual(disk["freeBlocks"], (65533 - 256 + 1) - 4096 - 16384 - 4096)
        self.assertNotIn("dataFileSystem", disk)
        text = run("disk", self.image).stdout
        self.assertIn("<- Data", text)
        self.assertIn("Data is not mounted", text)
        # A table byte changed behind the CRC; no signature.
        with open(self.image, "r+b") as f:
            f.seek(2 * 4096 + 40)
            f.write(b"\x01")
            f.seek(440)
            f.write(b"\0\0\0\0")
        disk = json.loads(run("disk", self.image, "--json").stdout)
        self.assertFalse(disk["gptValid"])
        self.assertFalse(disk["zarnSignature"])

    def test_usage_and_exit_statuses(self):
        self.assertEqual(run("--help").returncode, 0)
        self.assertIn("usage: zarnutil", run("--help").stdout)
        self.assertRegex(run("--version").stdout, r"^zarnutil \(vitd\) \d+\.\d+\n$")
        for args in ((), ("frobnicate", self.image), ("show",), ("show", "--strict", self.image),
                     ("--block-size", "0", "show", self.image), ("check", self.image, self.image),
                     ("map", "--json", self.image), ("show", "--bogus", self.image), ("show", self.image, "--block-size")):
            result = run(*args)
            self.assertEqual(result.returncode, 64, args)
            self.assertIn("Try 'zarnutil --help'.", result.stderr)
        result = run("show", self.dir.name)  # a folder is no medium
        self.assertEqual(result.returncode, 65)
        self.assertIn("zarnutil: ", result.stderr)
        self.assertEqual(run("show", self.dir.name + "/missing").returncode, 66)


if __name__ == "__main__":
    BIN = sys.argv.pop(1)
    unittest.main()
