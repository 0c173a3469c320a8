"""Checks that includes point one way only: apps -> product (its public face) -> platform/include, and, within a
program, from its upper rooms to its lower ones.

    includes.py ROOT

Looks at the #include lines themselves and finds each included file as the compiler would: beside the including file,
then in the include directories of the rooms. The page for hosts with a platform of their own must name each header that
the product includes from the platform, and no other.
"""

import fnmatch
import os
import re
import sys

import checkout

PRODUCT = "src/qvm_services/krutil_protobuf"
INCLUDE_DIRECTORIES = ["platform/include", "platform/src", PRODUCT, "apps"]
INCLUDE = re.compile(r'^[ \t]*#[ \t]*include[ \t]*([<"])([^>"]+)[>"]', re.MULTILINE)

# The headers that a platform of one's own must have, a row of a table for each.
PORTING = "docs/porting.md"
NEEDED = re.compile(r"^\| `([\w/]+\.hpp)` \|", re.MULTILINE)

# Pseudo rooms for what exists in the build tree only.
GENERATED = {"krutil.protobuf.*.pb.h": "product/generated", "*.pb.h": "platform/generated"}

# Room of the including file -> rooms it may include from. Rooms that are not named may include anything.
ALLOWED = {
    "platform/include": {"platform/include", "platform/generated"},
    "platform/src": {"platform/include", "platform/src", "platform/generated"},
    "product": {"product", "product/public", "product/generated", "platform/include", "platform/generated"},
    "product/public": {"platform/include"},
    "apps": {"apps", "product/public", "product/generated", "platform/include", "platform/generated"},
}

# The rooms of the programs, from the bottom up: a file includes from its own room and from those before it. What lies
# beside the rooms may include all of them. Neither program includes from the other, nor does what both share.
PROGRAM_ROOMS = {
    "apps/common": [],
    "apps/krutil": ["base", "arrays", "display", "session", "terminal", "inspect", "replay", "commands"],
    "apps/qvm": ["process", "requests", "python"],
}

# Headers of platform/include that serve the reference host alone: a host with a platform of its own lacks them.
HOST_ONLY = {
    "foundation/core/diag/AssertionSwitch.hpp",
    "foundation/core/posix/EventDescriptor.hpp",
    "foundation/core/posix/OwnedDescriptor.hpp",
    "foundation/core/posix/SignalsBlocked.hpp",
    "foundation/core/posix/writeFully.hpp",
    "foundation/msg_svc/transport/layers/session/Limits.hpp",
    "foundation/msg_svc/transport/layers/session/Session.hpp",
    "foundation/msg_svc/transport/layers/session/SessionConfig.hpp",
    "foundation/msg_svc/transport/layers/session/SessionError.hpp",
    "foundation/msg_svc/transport/layers/session/SessionRecorder.hpp",
    "foundation/vantor/carrier/framing/BufferAllocator.hpp",
}

# The layer that serves any protocol, and the interfaces that only one of them is about.
SESSION_LAYER = "foundation/msg_svc/transport/layers/session/"
PROTOCOLS_OWN = "platform/include/krutil/"


def room(path):
    if path == f"{PRODUCT}/KrutilProtocol.hpp":
        return "product/public"
    if path.startswith("src/"):
        return "product"
    for name in ("platform/include", "platform/src", "apps"):
        if path.startswith(name + "/"):
            return name
    return path.split("/")[0]


def program_room(path):
    """The program that a path below apps/ belongs to, and how high its room lies there; None for other paths."""
    parts = path.split("/")
    program = "/".join(parts[:2])
    if program not in PROGRAM_ROOMS:
        return None
    rooms = PROGRAM_ROOMS[program]
    if len(parts) == 3:
        return program, len(rooms)
    return program, rooms.index(parts[2]) if parts[2] in rooms else -1


def check_programs(place, including, included):
    """Findings about an include within apps/."""
    source, target = program_room(including), program_room(included)
    if source is None or target is None:
        return []
    findings = []
    if source[1] < 0:
        findings.append(f"{place}: {including} is in no room of {source[0]}; tests/repository/includes.py lists them")
    elif target[0] not in (source[0], "apps/common"):
        findings.append(f"{place}: {source[0]} must not include {included} of {target[0]}")
    elif target[0] == source[0] and target[1] > source[1]:
        findings.append(f"{place}: {included} lies in a room above that of {including}")
    return findings


def resolve(root, including, bracket, name):
    """The room of an included file and its path; None for a system header; an unknown room for what is nowhere."""
    for pattern, generated in GENERATED.items():
        if "/" not in name and fnmatch.fnmatch(name, pattern):
            return generated, name
    directories = list(INCLUDE_DIRECTORIES)
    if bracket == '"':
        directories.insert(0, os.path.dirname(including))
    for directory in directories:
        path = os.path.normpath(os.path.join(directory, name))
        if os.path.isfile(os.path.join(root, path)):
            return room(path), path
    return None if bracket == "<" else ("nowhere", name)


def check_porting(root, places):
    """Findings about the page; places has each header of the platform that the product includes, and a place where."""
    listed = NEEDED.findall(checkout.read(root, PORTING))
    findings = [f"{places[name]}: {PORTING} does not list {name}, so other platforms lack it"
                for name in sorted(set(places) - set(listed))]
    findings += [f"{PORTING}: the product does not include {name}" for name in listed if name not in places]
    findings += [f"{PORTING}: {name} twice" for name in sorted(set(listed)) if listed.count(name) > 1]
    return findings


def check(root):
    findings = []
    platform = {}
    for path in checkout.files(root, ".hpp", ".cpp"):
        allowed = ALLOWED.get(room(path))
        if allowed is None:
            continue
        text = checkout.read(root, path)
        for match in INCLUDE.finditer(text):
            target = resolve(root, path, match[1], match[2])
            if target is None:
                continue
            place = f"{path}:{text.count(chr(10), 0, match.start(2)) + 1}"
            if target[0] == "nowhere":
                findings.append(f"{place}: {target[1]} is in no room; a library's header is included with <>")
            elif target[0] not in allowed:
                findings.append(f"{place}: {room(path)} must not include {target[1]} of {target[0]}")
            elif room(path).startswith("product") and match[2] in HOST_ONLY:
                findings.append(f"{place}: {target[1]} is the reference host's own; other platforms do not have it")
            elif SESSION_LAYER in path and target[1].startswith(PROTOCOLS_OWN):
                findings.append(f"{place}: the session layer serves any protocol, and {target[1]} is of one")
            else:
                findings += check_programs(place, path, target[1])
                if room(path).startswith("product") and target[0] == "platform/include":
                    platform.setdefault(match[2], place)
    for name in sorted(HOST_ONLY):
        if not os.path.isfile(os.path.join(root, "platform/include", name)):
            findings.append(f"tests/repository/includes.py: HOST_ONLY names {name}, which does not exist")
    return findings + check_porting(root, platform)


if __name__ == "__main__":
    checkout.report(check(sys.argv[1]), "include directions")
