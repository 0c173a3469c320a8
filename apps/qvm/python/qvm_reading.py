"""Reads the code before a cursor, as far as completion and inspection need it. Half a line is no valid code, so this
does not parse it."""

import re

from qvm_look import ABSENT, attribute, is_one_of, item, look_up

# Code this far before the cursor is not read.
_MAX_LENGTH = 100_000

_TOKEN = re.compile(r"""
    (?P<blank>[^\S\n]+|\\\n)
  | (?P<comment>\#[^\n]*)
  | (?P<text>[A-Za-z]{0,2}(?P<quote>'{3}|"{3}|'|"))
  | (?P<word>\w+)
  | (?P<sign>.|\n)""", re.VERBOSE | re.DOTALL)
_REST = {quote: re.compile(rf"(?:\\.|[^\\\n{quote}])*(?P<end>{quote})?", re.DOTALL) for quote in "'\""}
_REST |= {3 * quote: re.compile(rf"(?:\\.|[^\\{quote}]|{quote}(?!{quote}{quote}))*(?P<end>{quote * 3})?", re.DOTALL)
          for quote in "'\""}
_OPENING = {")": "(", "]": "[", "}": "{"}


class Token:
    """A word, a text with its quotes, or a sign. partner is the opening bracket of a closing one, as an index."""

    __slots__ = "kind", "text", "begin", "partner"

    def __init__(self, kind, text, begin):
        self.kind, self.text, self.begin, self.partner = kind, text, begin, None


class Reading:
    """The code before a cursor.

    tokens  all of it, without blanks and comments
    open    indexes of the brackets that are open at the cursor, the innermost last
    inside  None, "comment", or the quotes of the text that the cursor is in; that text is the last token then
    """

    def __init__(self, code):
        begin = max(len(code) - _MAX_LENGTH, 0)
        self.tokens, self.open, self.inside = [], [], None
        while begin < len(code):
            match = _TOKEN.match(code, begin)
            kind, end = match.lastgroup, match.end()
            if match["text"]:
                kind, rest = "text", _REST[match["quote"]].match(code, end)
                end = rest.end()
                if not rest["end"] and end == len(code):
                    self.inside = match["quote"]
            elif kind == "comment" and end == len(code):
                self.inside = "comment"
            if kind not in ("blank", "comment"):
                self._add(Token(kind, code[begin:end], begin))
            begin = end

    def _add(self, token):
        if token.kind == "sign" and token.text in "([{":
            self.open.append(len(self.tokens))
        elif token.kind == "sign" and token.text in _OPENING and self.open:
            if self.tokens[self.open[-1]].text == _OPENING[token.text]:
                token.partner = self.open.pop()
        self.tokens.append(token)

    def sign(self, index):
        """The sign at the index; empty for anything else."""
        return self.tokens[index].text if 0 <= index < len(self.tokens) and self.tokens[index].kind == "sign" else ""

    def statement(self):
        """Tokens of the statement that the cursor is in."""
        depth, begin = 0, 0
        for index in range(len(self.tokens) - 1, -1, -1):
            sign = self.sign(index)
            if sign and sign in ")]}":
                depth += 1
            elif sign and sign in "([{":
                depth -= 1
            elif sign in ("\n", ";") and depth == 0:
                begin = index + 1
                break
        return self.tokens[begin:]

    def value_before(self, index, scopes):
        """The value of the names, attributes and literal subscripts that end before the index, without running code;
        ABSENT if code would have to run."""
        steps = []
        while index > 0:
            token = self.tokens[index - 1]
            if token.kind == "word" and not token.text[0].isdigit():
                if self.sign(index - 2) == ".":
                    steps.append((attribute, token.text))
                    index -= 2
                    continue
                value = next((value for value in (look_up(names, token.text) for names in scopes)
                              if value is not ABSENT), ABSENT)
            elif token.text == "]" and token.partner is not None:
                key = _literal(self.tokens[token.partner + 1:index - 1])
                before = token.partner - 1
                if key is ABSENT or before < 0 or self.tokens[before].kind == "text" or self.sign(before) not in (
                        "", "]"):
                    return ABSENT
                steps.append((item, key))
                index = token.partner
                continue
            elif token.kind == "text":
                value = _literal([token])
            else:
                return ABSENT
            for step, name in reversed(steps):
                if value is ABSENT:
                    break
                value = step(value, name)
            return value
        return ABSENT

    def has_value_before(self, index):
        """Whether a bracket at the index is a subscript or a call."""
        if index == 0:
            return False
        token = self.tokens[index - 1]
        return token.kind in ("word", "text") or token.text in (")", "]")


def _literal(tokens):
    """The number or the text that is written there; ABSENT for anything else."""
    from _ast import PyCF_ONLY_AST
    if not tokens or len(tokens) > 2 or any(len(token.text) > 1000 for token in tokens):
        return ABSENT
    if tokens[-1].kind not in ("text", "word") or (len(tokens) == 2 and tokens[0].text != "-"):
        return ABSENT
    last = tokens[-1].text
    if tokens[-1].kind == "word":
        if not (last.isdecimal() and last.isascii()):
            return ABSENT
        return -int(last) if len(tokens) == 2 else int(last)
    if "\\" in last and "r" not in last[:2].lower():
        return ABSENT  # an escape that is none would be a warning
    try:
        body = compile(last, "<qvm>", "eval", PyCF_ONLY_AST, True).body
    except (SyntaxError, ValueError):
        return ABSENT
    value = getattr(body, "value", ABSENT)
    return value if is_one_of(value, str, bytes) else ABSENT
