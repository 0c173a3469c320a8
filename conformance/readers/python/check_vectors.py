"""Reads the conformance vectors with Python's own implementation of Protocol Buffers, and writes them again.

    check_vectors.py SCHEMA

SCHEMA is a set of descriptors. Prints what differs from the manifest, one finding a line, and ends with status 1 then.
"""

import json
import os
import sys

import frames

from google.protobuf import json_format
from google.protobuf.message import DecodeError

NAME = "python"


def same(found, expected):
    """Whether two values of JSON are equal. A field that is 0 may be absent: this reader drops negative zeros too."""
    if isinstance(found, dict) and isinstance(expected, dict):
        return all(same(found.get(key, 0.0), expected.get(key, 0.0)) for key in found.keys() | expected.keys())
    if isinstance(found, list) and isinstance(expected, list):
        return len(found) == len(expected) and all(map(same, found, expected))
    return found == expected


def has_special_doubles(fields):
    """Whether there is a NaN, which JSON has without its payload, or a number 0 that was written, so a negative zero."""
    if isinstance(fields, dict):
        return any(map(has_special_doubles, fields.values()))
    if isinstance(fields, list):
        return any(map(has_special_doubles, fields))
    return fields == "NaN" or fields == 0 and not isinstance(fields, bool)


def check_content(content, entry, class_of, well_formed):
    """What is wrong about one content, or nothing."""
    expected = entry["parses"] != (NAME in entry.get("parses_differently_for", ()))
    message = class_of(entry["message"])()
    try:
        message.ParseFromString(content)
        parses = True
    except (DecodeError, UnicodeDecodeError) as error:
        parses = False
        why = error
    if parses != expected:
        return "expected it to be refused, but it was read" if parses else f"expected it to be read, got: {why}"
    if not parses or "fields" not in entry:
        return None
    found = json.loads(json_format.MessageToJson(message, preserving_proto_field_name=True))
    if not same(found, entry["fields"]):
        return f"expected {entry['fields']}, got {found}"
    again = message.SerializePartialToString()
    if well_formed and again != content and not has_special_doubles(entry["fields"]):
        return f"written again it is {again.hex(' ')} in place of {content.hex(' ')}"
    return None


def check_vector(vector, class_of):
    with open(os.path.join(frames.ROOT, vector["bytes"]), "rb") as file:
        data = file.read()
    message, = frames.split(data)
    if len(message) != len(vector["frames"]):
        yield f"expected {len(vector['frames'])} frames, got {len(message)}"
    for frame, entry in zip(message, vector["frames"]):
        tagged = entry["kind"] == "tagged"
        expected = frames.Frame(frames.TAGGED if tagged else frames.DATA, entry["frame_type"], entry["stream"],
                                entry["index"], entry.get("tag", ""),
                                data[entry["offset"]:entry["offset"] + entry["size"]])
        if frame != expected:
            yield f"expected {expected}, got {frame}"
        if "message" in entry:
            finding = check_content(frame.content, entry, class_of, vector["well_formed"])
            if finding:
                yield f"frame {entry['index']}: {finding}"


def main(schema):
    class_of = frames.message_classes(schema)
    vectors = frames.manifest()
    findings = [f"{vector['type']} {vector['name']}: {finding}" for vector in vectors
                for finding in check_vector(vector, class_of)]
    for finding in findings:
        print(finding)
    print(f"{len(vectors)} vectors, {len(findings)} findings")
    return 1 if findings else 0


if __name__ == "__main__":
    sys.exit(main(sys.argv[1]))
