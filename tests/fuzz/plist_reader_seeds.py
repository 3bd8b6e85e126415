#!/usr/bin/env python3
"""Writes the large seeds of the property-list reader's fuzz target into a directory: documents
nested far beyond the reader's limits and binary lists whose objects share or contain each other.
Too large to keep in the repository; run.sh makes them before each run."""
import struct
import sys
from pathlib import Path


def binary_list(objects):
    """A binary property list of encoded objects, the first at the top, 4-byte offsets and
    2-byte references."""
    body = bytearray(b"bplist00")
    offsets = []
    for obj in objects:
        offsets.append(len(body))
        body += obj
    table = len(body)
    for offset in offsets:
        body += struct.pack(">I", offset)
    body += bytes(6) + bytes([4, 2]) + struct.pack(">QQQ", len(objects), 0, table)
    return bytes(body)


def array_of(*refs):
    assert len(refs) < 15
    return bytes([0xA0 | len(refs)]) + b"".join(struct.pack(">H", r) for r in refs)


def chain(length, shared):
    objects = [array_of(i + 1, i + 1) if shared else array_of(i + 1) for i in range(length - 1)]
    return binary_list(objects + [b"\x51x"])


def main():
    out = Path(sys.argv[1])
    out.mkdir(parents=True, exist_ok=True)
    depth = 200000
    (out / "deep.xml").write_bytes(b"<plist>" + b"<array>" * depth + b"</array>" * depth + b"</plist>")
    (out / "deep-quoted.xml").write_bytes(
        b"<plist>" + b'<array x="/>">' * 1000 + b"</array>" * 1000 + b"</plist>")
    (out / "deep.bin").write_bytes(chain(30000, False))
    (out / "shared.bin").write_bytes(chain(40, True))
    (out / "cycle.bin").write_bytes(binary_list([array_of(1), array_of(0)]))


if __name__ == "__main__":
    main()
