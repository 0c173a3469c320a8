"""Checks that the documents list what is said when something is wrong, and that what they list is said.

    texts.py ROOT

Two kinds of texts: what a session says of a violation, and what conversions say. A text that is listed must stand in a
string of a test. What the code says must be listed: each string from which it puts a text together must be a part of a
listed one.
"""

import re
import sys

import checkout

# Document -> header of the tables whose first column lists texts of violations. In it, a word in capitals is a place
# for something else.
VIOLATIONS = {"docs/session-wire.md": "| text | the cause |", "docs/protocol.md": "| the session says | the cause |"}
PLACES = {r"\b[NMSTXY]\b": r"\d+", r"\b(?:TAG|READER|LIMIT|TEXT|PATH)\b|\\\.\\\.\\\.": ".*"}
# Where the code says them: in the arguments of these calls, and in these functions. What a sender is told before it
# sends is no violation.
SESSION = "platform/src/foundation/msg_svc/transport/layers/session/"
TO_SENDERS = SESSION + "PeerLimits.cpp"
SAYS = re.compile(r"\b(?:ProtocolViolation|refuse|refuseSize|onViolation)\(")
SAYING = re.compile(r"^std::string (?:refusalToReceive|FrameNotes::\w+)\(.*?^}", re.MULTILINE | re.DOTALL)

# The tables whose last column tells, in quotes, what conversions say; and the code of the conversions.
FAILURES = ("docs/protocol.md", "| failure", "| what arrives |")
CONVERSIONS = "src/qvm_services/krutil_protobuf/"

# What is not a string: comments, directives, characters. Group 2 is a raw string, group 3 any other.
TOKEN = re.compile(r"""//[^\n]*|/\*.*?\*/|^[ \t]*\#[^\n]*|'(?:\\.|[^'\\\n])'"""
                   r"""|R"(\w*)\((.*?)\)\1"|"((?:\\.|[^"\\\n])*)\"""", re.DOTALL | re.MULTILINE)


def strings(code):
    """The strings of C++ code; those that only white space parts are one."""
    found = []
    end = None
    for match in TOKEN.finditer(code):
        text = match[2] if match[2] is not None else match[3]
        if text is None:
            continue
        if match[3] is not None:
            text = re.sub(r'\\(["\\])', r"\1", text)
        if end is not None and not code[end : match.start()].strip():
            found[-1] += text
        else:
            found.append(text)
        end = match.end()
    return found


def arguments(code, start):
    """What stands from `start`, which is behind a parenthesis, up to the one that closes it."""
    depth = 1
    position = start
    for match in re.compile(rf"{TOKEN.pattern}|[()]", TOKEN.flags).finditer(code, start):
        depth += {"(": 1, ")": -1}.get(match[0], 0)
        position = match.start()
        if depth == 0:
            break
    return code[start:position]


def rows(text, *headers):
    """The rows, as lists of cells, of the tables whose header begins with one of these."""
    inside = False
    for line in text.split("\n"):
        inside = line.startswith("|") and (inside or line.startswith(headers))
        if inside and not line.startswith(("|--", *headers)):
            yield [cell.strip() for cell in line.strip("|").split("|")]


def pattern(text):
    """A regular expression for what a listed text of a violation stands for."""
    expression = re.escape(text).replace(r"\ ", " ")
    for place, content in PLACES.items():
        expression = re.sub(place, lambda _: content, expression)
    return re.compile(expression)


def is_sentence(text):
    """Whether a string is a piece of a sentence; one word may be a name."""
    return " " in text.strip()


def check(root):
    tested = "\n".join(text for path in checkout.files(root, ".cpp", ".hpp") if path.startswith("tests/")
                       for text in strings(checkout.read(root, path)))
    findings = []
    listed = []
    for path, header in VIOLATIONS.items():
        for row in rows(checkout.read(root, path), header):
            listed.append(row[0])
            if not pattern(row[0]).search(tested):
                findings.append(f'{path}: no test expects "{row[0]}"')
    for path in checkout.files(root, ".cpp"):
        if path.startswith(SESSION) and path != TO_SENDERS:
            code = checkout.read(root, path)
            parts = [arguments(code, match.end()) for match in SAYS.finditer(code)] + SAYING.findall(code)
            for text in sorted({text for part in parts for text in strings(part)}):
                if is_sentence(text) and not any(text.strip() in whole for whole in listed):
                    findings.append(f'{path}: {" and ".join(VIOLATIONS)} do not list "{text}"')

    document = checkout.read(root, FAILURES[0])
    for row in rows(document, *FAILURES[1:]):
        for text in re.findall(r'"([^"]+)"', row[-1]):
            if text not in tested:
                findings.append(f'{FAILURES[0]}: no test expects "{text}"')
    words = " ".join(document.split())
    for path in checkout.files(root, ".cpp", ".hpp"):
        if path.startswith(CONVERSIONS):
            for text in strings(checkout.read(root, path)):
                # What has parameters is the name of a function.
                if is_sentence(text) and "(" not in text and f'"{text}"' not in words:
                    findings.append(f'{path}: {FAILURES[0]} does not have "{text}"')
    return findings


if __name__ == "__main__":
    checkout.report(check(sys.argv[1]), "texts")
