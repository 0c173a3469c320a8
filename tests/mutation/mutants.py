"""Finds the places of a C++ source where one small change makes another program: its mutants.

It reads text, not syntax, and relies on how clang-format writes: a binary operator has a space on either side, which the
brackets of a template do not have. A change that does not compile is none, so a wrong guess costs a compilation.
"""

import dataclasses
import re


@dataclasses.dataclass(frozen=True)
class Mutant:
    path: str  # below the checkout
    line: int
    kind: str
    begin: int  # in the text
    end: int
    new: str  # what takes the place of the text from begin to end

    def apply(self, text):
        return text[: self.begin] + self.new + text[self.end :]


# What is replaced, by what. Each replacement is a mutant of its own.
OPERATORS = {
    " == ": [" != "],
    " != ": [" == "],
    " < ": [" <= ", " >= "],
    " <= ": [" < "],
    " > ": [" >= ", " <= "],
    " >= ": [" > "],
    " && ": [" || "],
    " || ": [" && "],
    " + ": [" - "],
    " - ": [" + "],
    " | ": [" & "],
    " & ": [" | "],
    " << ": [" >> "],
    " >> ": [" << "],
    " += ": [" -= "],
    " |= ": [" &= "],
    " ? ": [" == false ? "],
}
WORDS = {"true": "false", "false": "true"}

SKIPPED = re.compile(
    r"""//[^\n]* | ^[ ]*\#[^\n]* | \bstatic_assert\((?:[^;]|\n)*?;""", re.VERBOSE | re.MULTILINE)
STRING = re.compile(r'"(?:[^"\\\n]|\\.)*"')
CHARACTER = re.compile(r"'(?:[^'\\\n]|\\.)+'")
NUMBER = re.compile(r"(?<![\w.\"])(0[xX][0-9A-Fa-f]+|\d+)(?=[uUlL]*\b)(?!\.)")
NOT_A_STATEMENT = re.compile(
    r"(return\s|using\s|const\s|constexpr\s|static\s|auto\s|case\s|default\s*:|public|private|protected|"
    r"template|struct|class|enum|friend|explicit|virtual|inline|namespace|typedef|else\b|do\b|if\b|for\b|while\b|switch\b)")
STAYS = re.compile(
    r"(using|typedef|struct|class|enum|return|break|continue|throw|static|constexpr|\[\[)\b")
# A call, an assignment, a step, or what leaves a block.
STATEMENT = re.compile(r"((\*?[\w:.\[\]<>*]|->|\(\*?[\w:.]+\))+\(|\*?[\w.\[\]>-]+(\([\w ,.]*\))? [-+|&]?= |\+\+|--|throw\b|"
                       r"return;|break;|continue;|\[\[fallthrough)", re.DOTALL)
DECLARATION = re.compile(r"[\w:<>,&* ]+[&*>\w] [\w]+(\[\w*\])?( = |\(|\{|;)")
TEMPLATE = re.compile(r"template <[^\n]*>\n")
NO_FUNCTION = re.compile(r"\b(class|struct|namespace|enum|union)\b")
LABEL = re.compile(r"\b(case [\w:.]+|default)$")
# The order in which fields are set shows in nothing.
FIELD_SET = re.compile(
    r"(\*?proto\.(mutable_|set_|clear_)|(\w+::)*(fill|toProtobuf)\(|(header|entry|options)\.\w+ = |storeLittleEndian\()")


def blank(text, pattern):
    """The text with what the pattern finds as spaces, so that places stay what they are."""
    return pattern.sub(lambda found: re.sub(r"[^\n]", " ", found[0]), text)


def statements(code):
    """Where statements of function bodies begin and end, by block: what ends with a semicolon and has no braces inside.
    None stands for a block between them."""
    blocks, found, begin, depth = [None], [], 0, 0
    for place, character in enumerate(code):
        if character in "([":
            depth += 1
        elif character in ")]":
            depth -= 1
        elif character == "{":
            head = TEMPLATE.sub("", code[begin:place])
            blocks.append(None if NO_FUNCTION.search(head) else [])
            begin = place + 1
        elif character == "}":
            found.append(blocks.pop() or [])
            if blocks[-1] is not None:
                blocks[-1].append(None)
            begin = place + 1
        elif character == ";" and depth == 0:
            text = code[begin : place + 1]
            if blocks[-1] is not None:
                blocks[-1].append((begin + len(text) - len(text.lstrip()), place + 1))
            begin = place + 1
        elif character == ":" and ":" not in (code[place - 1], code[place + 1]) and LABEL.search(code[begin:place]):
            begin = place + 1
    return found


def is_action(text):
    return bool(STATEMENT.match(text)) and not NOT_A_STATEMENT.match(text.replace("return;", "leave;")) \
        and not DECLARATION.match(text)


def of_text(path, text):
    """All mutants of a source, in the order of their places."""
    found = []

    def add(kind, begin, end, new):
        found.append(Mutant(path, text.count("\n", 0, begin) + 1, kind, begin, end, new))

    without_comments = blank(text, SKIPPED)
    for string in STRING.finditer(without_comments):
        add("text", string.end() - 1, string.end() - 1, "~")
    code = blank(blank(without_comments, CHARACTER), STRING)

    for operator, others in OPERATORS.items():
        for place in re.finditer(re.escape(operator), code.replace("\n", " ")):
            for other in others:
                add("operator", place.start() + 1, place.end() - 1, other[1:-1])
    for place in re.finditer(r"(?<=[( ])!(?=[\w(*])", code):
        add("operator", place.start(), place.end(), "")
    for place in re.finditer(r"\+\+|--", code):
        add("operator", place.start(), place.end(), "--" if place[0] == "++" else "++")
    for place in NUMBER.finditer(code):
        add("constant", place.start(1), place.end(1), str(int(place[1], 0) + 1))
    for place in re.finditer(r"\b(true|false)\b", code):
        add("constant", place.start(), place.end(), WORDS[place[0]])
    for place in re.finditer(r"\bif \(", code):
        end = closing(code, place.end() - 1)
        if not re.search(r"[=<>!;]|&&|\|\|", code[place.end() : end]):
            add("operator", place.end(), end, f"!({text[place.end() : end]})")

    for block in statements(code):
        for this, following in zip(block, block[1:] + [None]):
            if this is None:
                continue
            begin, end = this
            if is_action(code[begin:end]):
                add("removed", begin, end, ";")
            if following and following[0] > end and not STAYS.match(code[begin:end]) \
                    and not STAYS.match(code[following[0] : following[1]]) \
                    and not (FIELD_SET.match(code[begin:end]) and FIELD_SET.match(code[following[0] : following[1]])):
                add("order", begin, following[1],
                    text[following[0] : following[1]] + text[end : following[0]] + text[begin:end])
    return sorted(found, key=lambda mutant: (mutant.begin, mutant.end, mutant.new))


def closing(code, opening):
    """Where the parenthesis ends that begins at opening."""
    depth = 0
    for place in range(opening, len(code)):
        depth += {"(": 1, ")": -1}.get(code[place], 0)
        if depth == 0:
            return place
    raise ValueError("a parenthesis that does not end")
