"""Recordings as docs/recording.md describes them, made of bytes that a test gives."""

import os
import shutil
import struct

ROOT = os.path.join(os.path.dirname(os.path.abspath(__file__)), "..", "..")
MOST = 262_144
TAGS = bytes.fromhex("000c0008") + b"krutil\0\0" + bytes(4)
INBOUND, OUTBOUND = 1, 2


def install(home):
    """Lays dissector and schema where Wireshark looks for those of a user whose home this is; returns an environment."""
    plugins = os.path.join(home, ".local", "lib", "wireshark", "plugins")
    schema = os.path.join(home, ".config", "wireshark", "protobuf")
    for directory in plugins, schema:
        os.makedirs(directory)
    shutil.copy(os.path.join(ROOT, "dissector", "krutil.lua"), plugins)
    for room in ("src", "qvm_services", "krutil_protobuf", "proto"), ("platform", "proto"):
        shutil.copytree(os.path.join(ROOT, *room), schema, dirs_exist_ok=True)
    return {**os.environ, "HOME": home, "XDG_CONFIG_HOME": os.path.join(home, ".config")}


def block(kind, body):
    size = struct.pack("<I", len(body) + 12)
    return struct.pack("<I", kind) + size + body + size


def option(code, value):
    return struct.pack("<HH", code, len(value)) + value + bytes(-len(value) % 4)


class Recording:
    """The blocks of one section, in the order of the calls."""

    def __init__(self, name="client 1"):
        self.time = 1_700_000_000_000_000_000
        self.blocks = [block(0x0A0D0D0A, struct.pack("<IHHq", 0x1A2B3C4D, 1, 0, -1)),
                       block(1, struct.pack("<HHI", 252, 0, MOST) + option(2, name.encode()) + option(9, b"\x09")
                             + option(0, b""))]

    def add(self, flags, unit, snap=None):
        """A unit, in as many packets as it takes; with `snap`, only its first bytes."""
        kept = unit if snap is None else unit[:snap]
        room = MOST - len(TAGS)
        for begin in range(0, max(len(kept), 1), room):
            part = kept[begin:begin + room]
            last = begin + room >= len(kept)
            options = option(2, struct.pack("<I", flags))
            if len(part) != len(unit):
                options += option(1, f"bytes {begin}-{begin + len(part) - 1} of {len(unit)}".encode())
            packet = TAGS + part
            original = len(packet) + (len(unit) - len(kept) if last else 0)
            self.time += 1000
            self.blocks.append(block(6, struct.pack("<IIIII", 0, self.time >> 32, self.time & 0xFFFFFFFF, len(packet),
                                                    original)
                                     + packet + bytes(-len(packet) % 4) + options + option(0, b"")))

    def bytes(self):
        return b"".join(self.blocks)
