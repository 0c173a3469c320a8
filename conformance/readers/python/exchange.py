"""Writes random messages with Python's own implementation of Protocol Buffers, has the library read them and write them
again, and compares what comes back field by field.

    exchange.py SCHEMA ECHO [COUNT [SEED]]

SCHEMA is a set of descriptors, ECHO the program krutil_conformance_echo, COUNT the number of messages of each type (1000
without it). Ends with status 1 at the first difference, which it tells with the seed. ../random.json holds what random
messages keep to.
"""

import json
import os
import random
import struct
import subprocess
import sys

import frames

from google.protobuf.descriptor import FieldDescriptor

# Messages that one run of the echo gets: few enough to be held, enough for the start of a program not to matter.
BATCH = 1000
STREAM = 7
DEEPEST = 3
LARGE = 2048  # bytes of elements from which the library puts them into a frame of their own

BITS = {FieldDescriptor.TYPE_INT32: (-2**31, 2**31 - 1), FieldDescriptor.TYPE_UINT32: (0, 2**32 - 1),
        FieldDescriptor.TYPE_INT64: (-2**63, 2**63 - 1), FieldDescriptor.TYPE_UINT64: (0, 2**64 - 1)}
# Bytes of an element, and the type of its data frame, by the code of its type.
ELEMENTS = {1: (1, 13), 2: (2, 14), 4: (4, 12), 5: (8, 11), 6: (1, 3), 7: (1, 4), 8: (2, 5), 9: (2, 6), 10: (4, 7),
            11: (4, 8), 12: (8, 9), 13: (8, 10), 14: (8, 16), 15: (16, 15), 16: (2, 17), 17: (2, 18), 18: (4, 19),
            19: (4, 20), 20: (8, 21), 21: (8, 22), 22: (16, 23), 23: (16, 24)}


def is_repeated(field):
    return field.label == FieldDescriptor.LABEL_REPEATED


class Writer:
    """Makes random messages; `types` tells message name and frame type by tag."""

    def __init__(self, class_of, types, rules, source):
        self.class_of = class_of
        self.types = types
        self.rules = rules
        self.random = source

    def message(self, tag):
        """The frames of one message."""
        self.frames = []
        self.append(tag)
        return self.frames

    def append(self, tag):
        """Appends an object's frames, those first that it refers to; returns the index of its own."""
        name, frame_type = self.types[tag]
        message = self.class_of(name)()
        if name == self.rules["arrays"]:
            self.fill_array(message)
        else:
            self.fill(message, name, 0)
        if tag in self.rules["state_events"]:
            message.type = self.rules["state_events"][tag]
        return self.append_frame(frames.TAGGED, frame_type, tag, message.SerializeToString())

    def append_frame(self, kind, frame_type, tag, content):
        index = len(self.frames) + 1
        self.frames.append(frames.Frame(kind, frame_type, STREAM, index, tag, content))
        return index

    def fill(self, message, path, depth):
        chosen = {self.random.choice(one.fields).name for one in message.DESCRIPTOR.oneofs}
        for field in message.DESCRIPTOR.fields:
            place = f"{path}.{field.name}"
            if {place, field.full_name} & set(self.rules["left_out"]):
                continue
            if field.containing_oneof and field.name not in chosen:
                continue
            if field.full_name in self.rules["present_or_not"] and self.random.random() < 0.5:
                continue
            if field.message_type:
                self.fill_messages(message, field, place, depth)
            elif is_repeated(field):
                values = [self.value(field) for _ in range(self.random.randrange(4))]
                # Lists of enumerators are sets, which the library writes in ascending order.
                getattr(message, field.name).extend(sorted(set(values)) if field.enum_type else values)
            else:
                setattr(message, field.name, self.value(field))

    def fill_messages(self, message, field, place, depth):
        if not is_repeated(field):
            getattr(message, field.name).SetInParent()
            self.fill(getattr(message, field.name), place, depth)
        elif depth < DEEPEST:
            for _ in range(self.random.randrange(3)):
                self.fill(getattr(message, field.name).add(), place, depth + 1)

    def value(self, field):
        if field.full_name in self.rules["references"]:
            tag = self.random.choice(self.rules["references"][field.full_name])
            return self.append(tag) if tag else 0
        if field.type == FieldDescriptor.TYPE_ENUM:
            least = 1 if field.enum_type.full_name in self.rules["no_default_number"] else 0
            return self.random.choice(field.enum_type.values[least:]).number
        value = self.scalar(field.type)
        while not value and field.full_name in self.rules["not_zero_or_empty"]:
            value = self.scalar(field.type)
        return value

    def scalar(self, kind):
        if kind == FieldDescriptor.TYPE_BOOL:
            return self.random.random() < 0.5
        if kind == FieldDescriptor.TYPE_STRING:
            return self.text()
        if kind == FieldDescriptor.TYPE_DOUBLE:
            return self.double()
        least, most = BITS[kind]
        value = self.random.choice((least, most, 0, 1, self.random.randint(least, most),
                                    self.random.randint(least, most) >> self.random.randrange(64)))
        return min(max(value, least), most)

    def text(self):
        ends = self.random.choice((0x7F, 0x7FF, 0xD7FF, 0x10FFFF))
        characters = (self.random.randint(0, ends) for _ in range(self.random.choice((0, 1, 5, 200))))
        return "".join(chr(each) for each in characters if not 0xD800 <= each <= 0xDFFF)

    def double(self):
        value, = struct.unpack("<d", self.random.randbytes(8))
        value = self.random.choice((value, 0.0, 1.5, -1.0, float("inf"), -float("inf"), 5e-324, float("nan")))
        return float("nan") if value != value else value  # This reader drops what else a NaN holds.

    def fill_array(self, message):
        message.elementType = self.random.choice(list(ELEMENTS))
        size, data_type = ELEMENTS[message.elementType]
        message.dimensions.extend(self.random.randrange(6) for _ in range(self.random.randrange(4)))
        if self.random.random() < 0.1:
            message.dimensions.append(self.random.randrange(1000))
        message.order = self.random.choice((1, 2))
        for extent in message.dimensions:
            size *= extent
        content = bytes(self.random.choices((0, 1), k=size)) if message.elementType == 1 else self.random.randbytes(size)
        if size < LARGE:
            message.inlineElements = content
        else:
            message.dataID = self.append_frame(frames.DATA, data_type, "", content)


def differences(ours, theirs, path):
    """The paths at which two messages of one type differ."""
    for field in ours.DESCRIPTOR.fields:
        place = f"{path}.{field.name}"
        mine, yours = getattr(ours, field.name), getattr(theirs, field.name)
        if is_repeated(field):
            if len(mine) != len(yours):
                yield f"{place}: {len(mine)} values were written, {len(yours)} came back"
            pairs = zip(mine, yours)
        else:
            if field.has_presence and ours.HasField(field.name) != theirs.HasField(field.name):
                yield f"{place}: written: {ours.HasField(field.name)}, came back: {theirs.HasField(field.name)}"
            pairs = [(mine, yours)]
        for one, other in pairs:
            if field.message_type:
                # Fields of an absent message are defaults, and a type may hold itself.
                if is_repeated(field) or ours.HasField(field.name):
                    yield from differences(one, other, place)
            elif one != other and not (one != one and other != other):
                yield f"{place}: {one!r} was written, {other!r} came back"


def compare(written, returned, writer):
    """What is different between the frames of one message, as they went and came."""
    if [frames.dataclasses.replace(each, content=b"") for each in written] != \
            [frames.dataclasses.replace(each, content=b"") for each in returned]:
        yield f"frames {[each.tag for each in written]} were written, {[each.tag for each in returned]} came back"
        return
    for ours, theirs in zip(written, returned):
        if ours.kind == frames.DATA:
            if ours.content != theirs.content:
                yield f"frame {ours.index}: its data came back changed"
            continue
        name = writer.types[ours.tag][0]
        class_of = writer.class_of(name)
        yield from differences(class_of.FromString(ours.content), class_of.FromString(theirs.content), name)


def exchange(writer, tag, count, echo):
    written = [writer.message(tag) for _ in range(count)]
    done = subprocess.run([echo], input=b"".join(map(frames.join, written)), stdout=subprocess.PIPE, check=False)
    if done.returncode != 0:
        return [f"{tag}: {echo} has ended with status {done.returncode}"]
    returned = frames.split(done.stdout)
    if len(returned) != count:
        return [f"{tag}: {count} messages were written, {len(returned)} came back"]
    return [f"{tag}: message {number}: {finding}" for number, pair in enumerate(zip(written, returned), 1)
            for finding in compare(*pair, writer)]


def main(schema, echo, count="1000", seed="1"):
    types = {entry["tag"]: (entry["message"], entry["frame_type"]) for vector in frames.manifest()
             if vector["well_formed"] for entry in vector["frames"] if entry["kind"] == "tagged"}
    with open(os.path.join(frames.HERE, "..", "random.json"), encoding="utf-8") as file:
        rules = json.load(file)
    writer = Writer(frames.message_classes(schema), types, rules, random.Random(int(seed)))
    for tag in types:
        for begin in range(0, int(count), BATCH):
            findings = exchange(writer, tag, min(BATCH, int(count) - begin), echo)
            if findings:
                print(*findings[:10], f"(seed {seed}, behind {begin} messages of this type)", sep="\n")
                return 1
    print(f"{len(types)} types, {count} messages each: all came back as they were written")
    return 0


if __name__ == "__main__":
    sys.exit(main(*sys.argv[1:]))
