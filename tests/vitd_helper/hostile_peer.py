#!/usr/bin/env python3
"""A peer without the helper's entitlement, as any local user is: it drops
to uid/gid 65534 (unless HOSTILE_AS_ROOT is set: root without the
entitlement) and attacks the helper's socket in one of these ways, printing
what it saw as one line of "key=value" words.

  hostile_peer.py SOCKET idle N        open N connections and hold them;
                                       prints how many the helper closed at once
  hostile_peer.py SOCKET tiny N        send N tiny valid frames on a few connections
  hostile_peer.py SOCKET nulls MIB     one frame of MIB MiB: a dictionary holding
                                       an array of nulls
  hostile_peer.py SOCKET linger        connect, send nothing; prints the seconds
                                       until the helper closes the connection
"""
import os
import socket
import struct
import sys
import time

NOBODY = 65534


def connect(path):
    s = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
    s.connect(path)
    return s


def closed_by_peer(s, wait):
    s.settimeout(wait)
    try:
        return s.recv(1) == b""
    except socket.timeout:
        return False
    except ConnectionResetError:
        return True


def frame(body):
    return struct.pack("<I", len(body)) + body


def ping():
    # {"k": null}
    return frame(b"\x0a" + struct.pack("<I", 1) + struct.pack("<I", 1) + b"k" + b"\x00")


def main():
    path, mode, arg = sys.argv[1], sys.argv[2], (sys.argv[3] if len(sys.argv) > 3 else "0")
    if not os.environ.get("HOSTILE_AS_ROOT"):
        os.setgroups([])
        os.setgid(NOBODY)
        os.setuid(NOBODY)
    if mode == "idle":
        held = [connect(path) for _ in range(int(arg))]
        time.sleep(1)
        closed = 0
        for s in held:
            s.setblocking(False)
            try:
                closed += s.recv(1) == b""
            except BlockingIOError:
                pass
            except ConnectionResetError:
                closed += 1
        print(f"opened={len(held)} closed={closed}")
    elif mode == "tiny":
        peers = [connect(path) for _ in range(4)]
        batch = ping() * 1000
        for i in range(int(arg) // 1000):
            try:
                peers[i % len(peers)].sendall(batch)
            except (BrokenPipeError, ConnectionResetError):
                peers[i % len(peers)] = connect(path)
        print("sent")
    elif mode == "nulls":
        size = int(arg) << 20
        count = size - 15
        head = b"\x0a" + struct.pack("<I", 1) + struct.pack("<I", 1) + b"k" + b"\x09" + struct.pack("<I", count)
        s = connect(path)
        s.sendall(struct.pack("<I", size) + head)
        chunk = b"\x00" * (1 << 20)
        left = count
        while left > 0:
            n = min(left, len(chunk))
            s.sendall(chunk[:n])
            left -= n
        s.sendall(ping())
        print(f"sent={size} closed={int(closed_by_peer(s, 2))}")
    elif mode == "linger":
        s = connect(path)
        start = time.monotonic()
        closed = closed_by_peer(s, 30)
        print(f"closed={int(closed)} seconds={time.monotonic() - start:.1f}")


if __name__ == "__main__":
    main()
