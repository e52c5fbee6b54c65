#!/usr/bin/python3
"""Holds the library against the second decoder on random frames.

    compare.py PROGRAM SOURCE FRAMES [SEED]

PROGRAM is second_opinion, SOURCE the folder of the project, FRAMES how many. The frames are the golden ones, frames made at random for
every message, and both again with bytes, lengths, ends, headers and identities changed. Exits with 1 when the two differ.
"""
import collections
import pathlib
import random
import re
import subprocess
import sys
import tempfile

import wire

IDENTITIES = list(wire.MESSAGES) + list(wire.HANDSHAKE)
FLAGS = {wire.REQUEST: 0x80, wire.RESPONSE: 0x40, wire.ASYNCHRONOUS: 0x00}

# The 16- and 32-bit fields of payloads that hold lengths or offsets: where they are, how long they are.
LENGTH_FIELDS = [(0, 2), (0, 4), (2, 2), (4, 2), (8, 2), (12, 2), (14, 2)]


def golden_frames(folder):
    frames = []
    for path in sorted(folder.glob("*.txt")):
        rows = path.read_text().split("frame:\n")[1].splitlines()
        text = "".join(re.match(r"[0-9A-F]+  ((?:[0-9A-F]{2} ?)+)", row).group(1) for row in rows)
        frames.append(bytes.fromhex(text))
    return frames


class Maker:
    def __init__(self, seed, golden):
        self.chance = random.Random(seed)
        self.golden = golden

    def small(self, edges):
        """A number that is often one of the edges or beside one."""
        if self.chance.random() < 0.6:
            return max(0, self.chance.choice(edges) + self.chance.randint(-1, 1))
        return self.chance.randint(0, 70)

    def frame(self, identity, payload, is_old=False, pad=None):
        function, operation, kind = identity
        if pad is None:
            pad = wire.old_pad(len(payload)) if is_old else 0
        header = 24 if is_old else 32
        flags = FLAGS[kind] | (self.chance.randint(0, 0x3F) if self.chance.random() < 0.2 else 0)
        octets = b"\xDE\xCA\xFF" + (b"\x00" if is_old else b"\x20")
        octets += (header + len(payload) + pad).to_bytes(4, "big") + self.chance.randbytes(4)
        octets += function.to_bytes(2, "big") + bytes([flags, pad]) + len(payload).to_bytes(4, "big")
        octets += operation.to_bytes(2, "big") + (self.chance.randint(0, 60)).to_bytes(2, "big")
        if not is_old:
            octets += self.chance.randbytes(8)
        return octets + payload + bytes(pad)

    def golden_payload(self):
        """An identity and the payload of its golden frame, cut or grown now and then."""
        frame = wire.Frame(self.chance.choice(self.golden))
        payload = frame.payload
        if self.chance.random() < 0.3:
            payload = payload[:self.chance.randint(0, len(payload))]
        elif self.chance.random() < 0.2:
            payload += self.chance.randbytes(self.chance.randint(1, 8))
        return (frame.function, frame.operation, wire.classification(frame.flags)), bytearray(payload)

    def made(self):
        if self.chance.random() < 0.5:
            identity, payload = self.golden_payload()
        else:
            identity = self.chance.choice(IDENTITIES)
            payload = bytearray(self.chance.randbytes(self.small([0, 2, 3, 4, 5, 6, 8, 16, 32, 42, 46, 48, 64])))
        for offset, size in LENGTH_FIELDS:
            if offset + size <= len(payload) and self.chance.random() < 0.3:
                value = self.small([0, 1, 4, 8, 16, 32, 42, 46, max(0, len(payload) - 46), len(payload)])
                payload[offset:offset + size] = value.to_bytes(size, "big")
        if self.chance.random() < 0.2:  # nothing where something is needed
            offset, size = self.chance.choice(LENGTH_FIELDS)
            payload[offset:min(offset + size, len(payload))] = bytes(max(0, min(size, len(payload) - offset)))
        if payload and self.chance.random() < 0.3:  # a code, a flag
            payload[min(len(payload) - 1, self.chance.choice([2, 4, 7]))] = self.chance.choice([0x00, 0x01, 0x80, 0xFF])
        is_old = self.chance.random() < 0.3
        pad = None
        if self.chance.random() < 0.1:
            pad = self.chance.randint(0, 255)
        return self.frame(identity, bytes(payload), is_old, pad)

    def changed(self, octets):
        octets = bytearray(octets)
        for _ in range(self.chance.choice([0, 0, 1, 1, 1, 2, 3])):
            way = self.chance.randint(0, 6)
            if not octets:
                break
            if way == 0:
                octets[self.chance.randrange(len(octets))] = self.chance.randint(0, 255)
            elif way == 1:  # a byte of the header
                octets[self.chance.randrange(min(32, len(octets)))] ^= 1 << self.chance.randint(0, 7)
            elif way == 2:  # the end is missing
                del octets[self.chance.randrange(len(octets)):]
            elif way == 3:  # more than the frame
                octets += self.chance.randbytes(self.chance.randint(1, 20))
            elif way == 4 and len(octets) >= 20:  # a length by one or by much
                offset = self.chance.choice([4, 16])
                value = wire.number(octets, offset, 4) + self.chance.choice([-1, 1, -16, 16, 0x10000, 0xFFFFFFF0])
                octets[offset:offset + 4] = (value % 2**32).to_bytes(4, "big")
            elif way == 5 and len(octets) >= 22:  # another identity
                function, operation, kind = self.chance.choice(IDENTITIES)
                octets[12:14] = function.to_bytes(2, "big")
                octets[14] = FLAGS[kind]
                octets[20:22] = operation.to_bytes(2, "big")
            elif way == 6 and len(octets) >= 34:  # a field of the payload
                offset = 32 + 2 * self.chance.randrange((len(octets) - 32) // 2)
                octets[offset:offset + 2] = self.small([0, 1, 16, 32, 42, 46, len(octets) - 32]).to_bytes(2, "big")
        return bytes(octets)

    def next(self):
        first = self.chance.choice(self.golden) if self.chance.random() < 0.3 else self.made()
        return self.changed(first)


def kind(verdict):
    """The text of the refusal, or the name of the message."""
    for mark in ("malformed: ", " because: "):
        if mark in verdict:
            return verdict.split(mark)[1]
    return verdict.split()[0]


# Refusals that a registry cannot be made to give: of the message stream, of a null pointer, of a class used directly.
UNREACHABLE = {"Invalid length", "i_buffer", "bad operation"}


def refusals_of(document):
    """The texts in the tables of checks."""
    texts = set()
    is_table_of_checks = False
    for line in document.read_text().splitlines():
        cells = [cell.strip() for cell in line.strip("|").split("|")]
        if not line.startswith("|"):
            is_table_of_checks = False
        elif any(cell.startswith("Check") for cell in cells) and "Text" in cells:
            is_table_of_checks = True
            column = cells.index("Text")
        elif is_table_of_checks and cells[column].startswith('"'):
            texts.add(cells[column].strip('"'))
    texts.add("dataLength shorter than actual data size")  # stated once, before the virtual serial messages
    return texts - UNREACHABLE


def compare(program, frames, kinds):
    """Gives the frames to the program. Returns the number of those on which the two differ."""
    with tempfile.TemporaryFile() as wanted:
        for frame in frames:
            wanted.write(len(frame).to_bytes(4, "big") + frame)
        wanted.seek(0)
        answers = subprocess.run([program], stdin=wanted, stdout=subprocess.PIPE, check=True, text=True).stdout.splitlines()
    if len(answers) != 2 * len(frames):
        raise SystemExit(f"second opinion: FAILED: {len(answers)} verdicts for {len(frames)} frames")
    different = 0
    for index, frame in enumerate(frames):
        mine = [wire.verdict(frame, wire.MESSAGES), wire.verdict(frame, wire.HANDSHAKE)]
        kinds[kind(mine[0])] += 1
        for registry, ours, library in zip(("public", "internal"), mine, answers[2 * index:2 * index + 2]):
            if ours != library:
                different += 1
                if different <= 5:
                    print(f"{frame.hex()}\n  {registry} registry: {library}\n  document: {ours}")
    return different


def main():
    program, source, count = sys.argv[1], pathlib.Path(sys.argv[2]), int(sys.argv[3])
    seed = int(sys.argv[4]) if len(sys.argv) > 4 else random.SystemRandom().randrange(2**32)
    refusals = refusals_of(source / "docs/wire-format.md")
    golden = golden_frames(source / "vectors")
    maker = Maker(seed, golden)
    kinds = collections.Counter()
    different = compare(program, golden, kinds)
    left = count
    while left > 0:
        batch = min(left, 20000)
        different += compare(program, [maker.next() for _ in range(batch)], kinds)
        left -= batch
    for name, number in sorted(kinds.items(), key=lambda item: -item[1]):
        print(f"{number:9}  {name}")
    missing = refusals | {name for name, _ in wire.MESSAGES.values()} | {"unknown"}
    missing -= set(kinds)
    if missing:
        raise SystemExit(f"second opinion: FAILED: these were never met (seed {seed}): {sorted(missing)}")
    if different:
        raise SystemExit(f"second opinion: FAILED: {different} different verdicts (seed {seed})")
    print(f"second opinion: PASSED: {len(golden)} golden and {count} random frames, seed {seed}")


if __name__ == "__main__":
    main()
