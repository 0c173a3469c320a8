"""What the Python readers share: the manifest, the message classes, and frames as they travel.

Python's own implementation of Protocol Buffers is chosen here, before anything imports it: what most systems have by
default is the C++ library behind Python's names, which is no second reader. So import this module first.
"""

import dataclasses
import json
import os
import struct

os.environ["PROTOCOL_BUFFERS_PYTHON_IMPLEMENTATION"] = "python"

from google.protobuf import descriptor_pb2, descriptor_pool, message_factory  # noqa: E402
from google.protobuf.internal import api_implementation  # noqa: E402

assert api_implementation.Type() == "python", api_implementation.Type()

HERE = os.path.dirname(os.path.abspath(__file__))
ROOT = os.path.join(HERE, "..", "..")

# kind, frame type, tag size, stream ID, frame index, content size
HEADER = struct.Struct("<BBHIQQ")
TAGGED, DATA, LAST = 1, 2, 0x80


@dataclasses.dataclass
class Frame:
    kind: int
    type: int
    stream: int
    index: int
    tag: str
    content: bytes


def manifest():
    with open(os.path.join(ROOT, "manifest.json"), encoding="utf-8") as file:
        return json.load(file)["vectors"]


def message_classes(schema):
    """A function from full names to message classes; `schema` is the path of a set of descriptors."""
    pool = descriptor_pool.DescriptorPool()
    with open(schema, "rb") as file:
        for each in descriptor_pb2.FileDescriptorSet.FromString(file.read()).file:
            pool.Add(each)
    # Newer versions of protobuf have a function in place of the factory.
    class_of = getattr(message_factory, "GetMessageClass", None) or message_factory.MessageFactory(pool).GetPrototype
    return lambda name: class_of(pool.FindMessageTypeByName(name))


def split(data):
    """The messages in these bytes, each a list of frames."""
    messages, frames, at = [], [], 0
    while at < len(data):
        kind, frame_type, tag_size, stream, index, size = HEADER.unpack_from(data, at)
        at += HEADER.size
        tag = data[at:at + tag_size].decode()
        content = data[at + tag_size:at + tag_size + size]
        at += tag_size + size
        if at > len(data):
            raise ValueError(f"{at - len(data)} bytes of the last frame are missing")
        frames.append(Frame(kind & ~LAST, frame_type, stream, index, tag, content))
        if kind & LAST:
            messages.append(frames)
            frames = []
    if frames:
        raise ValueError("the last frame of a message is missing")
    return messages


def join(frames):
    """One message as bytes."""
    parts = []
    for frame in frames:
        tag = frame.tag.encode()
        kind = frame.kind | (LAST if frame is frames[-1] else 0)
        parts += [HEADER.pack(kind, frame.type, len(tag), frame.stream, frame.index, len(frame.content)), tag,
                  frame.content]
    return b"".join(parts)
