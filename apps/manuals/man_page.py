"""Manual pages: a template, filled with what a program's option table knows.

In a template, these lines stand for what the table has:

    @SYNOPSIS@      how the program and its commands are called
    @COMMANDS@      each command with its arguments, and with the options that no other command has
    @OPTIONS@       the options that several commands have; all options of a program without commands
    @NOTES Title@   the paragraph of a help text's end that begins with "Title:"

and @VERSION@ for the project's version, at any place.
"""

import re
import textwrap


def escaped(text):
    """Text as roff shows it; a dash is one that can be copied to a command line."""
    return text.replace("\\", "\\e").replace("-", "\\-")


def filled(text):
    """A paragraph that roff fills, one sentence a line, in lines below 80 bytes."""
    lines = []
    for sentence in re.split(r"(?<=[.?!;:]) (?=[A-Z])", " ".join(text.split())):
        lines += textwrap.wrap(escaped(sentence), 78, break_long_words=False, break_on_hyphens=False)
    # A line that begins with one of these would be a request.
    return "\n".join("\\&" + line if line[0] in ".'" else line for line in lines)


def tagged(tag, text):
    return f".TP\n{tag}\n{filled(text)}"


def names(option):
    value = f" \\fI{escaped(option['value'])}\\fR" if option["value"] else ""
    return ", ".join(f"\\fB{escaped(name)}\\fR" for name in option["names"]) + value


def option_entry(option):
    default = f" (default: {option['default']})" if option["default"] else ""
    return tagged(names(option), option["description"] + default)


def by_group(options, heading):
    """Entries of options under the headings of their groups, in the order in which groups come."""
    groups = list(dict.fromkeys(option["group"] for option in options))
    parts = []
    for group in groups:
        parts.append(heading(group))
        parts += [option_entry(option) for option in options if option["group"] == group]
    return "\n".join(parts)


def shared_options(program):
    """The options that several commands of a program have; all of a program without commands."""
    commands = program["commands"]
    if not commands:
        return program["options"]
    found = []
    for option in (option for command in commands for option in command["options"]):
        if option not in found and sum(option in command["options"] for command in commands) > 1:
            found.append(option)
    return found


def listed(words):
    return words[0] if len(words) == 1 else f"{', '.join(words[:-1])} and {words[-1]}"


def shared_note(command, shared):
    """Which of the options that are described once a command takes: whole groups where it takes all of them."""
    groups = {}
    for option in shared:
        groups.setdefault(option["group"], []).append(option)
    whole = [group for group, options in groups.items() if all(option in command["options"] for option in options)]
    single = [option["names"][-1] for option in shared
              if option in command["options"] and option["group"] not in whole]
    parts = ([f"those of the groups {listed(whole)}"] if whole else []) + ([listed(single)] if single else [])
    return f"Of the options below, it takes {', and '.join(parts)}." if parts else ""


def call(program, command=None):
    """A line of the synopsis."""
    parts = [f"\\fB{escaped(program['name'])}\\fR"]
    if command:
        parts.append(f"\\fB{escaped(command['name'])}\\fR")
    parts.append("[\\fIOPTIONS\\fR]")
    for positional in (command or program)["positionals"]:
        word = f"\\fI{escaped(positional['name'])}\\fR" + (" ..." if positional["repeated"] else "")
        parts.append(word if positional["required"] else f"[{word}]")
    return " ".join(parts)


def synopsis(program):
    return "\n.br\n".join([call(program)] + [call(program, command) for command in program["commands"]])


def commands(program):
    shared = shared_options(program)
    parts = []
    for command in program["commands"]:
        parts += [f".SS {command['name']}", call(program, command), ".PP", filled(command["description"] + ".")]
        note = shared_note(command, shared)
        if note:
            parts.append(filled(note))
        parts += [tagged(f"\\fI{escaped(positional['name'])}\\fR", positional["description"])
                  for positional in command["positionals"]]
        parts += [option_entry(option) for option in command["options"] if option not in shared]
    return "\n".join(parts)


def options(program):
    shared = shared_options(program)
    parts = []
    if program["commands"]:
        parts.append(by_group([option for option in program["options"] if option not in shared],
                              lambda group: ".SS Without a command"))
    parts.append(by_group(shared, lambda group: f".SS {escaped(group)}"))
    return "\n".join(parts)


def notes(program, title):
    """A paragraph of the end of a help text: entries of two columns, or text."""
    found = set()
    for command in [program] + program["commands"]:
        found |= {part for part in command["footer"].split("\n\n") if part.startswith(title + ":\n")}
    if len(found) != 1:
        raise ValueError(f"{program['name']}: expected one paragraph \"{title}:\" below its help texts, "
                         f"got {len(found)}")
    parts = []
    for line in found.pop().split("\n")[1:]:
        entry = re.match(r"  (\S(?:.*\S)?) {2,}(\S.*)$", line)
        if entry:
            parts.append((entry[1], entry[2]))
        elif parts and (line.startswith("   ") or (line.startswith("  ") and not parts[-1][0])):
            parts[-1] = (parts[-1][0], f"{parts[-1][1]} {line.strip()}")
        else:
            parts.append(("", line.strip()))
    first = not parts[0][0]
    return "\n".join(tagged(f"\\fB{escaped(tag)}\\fR", text) if tag else f".PP\n{filled(text)}"
                     for tag, text in parts)[len(".PP\n") if first else 0:]


def fill(template, program, version):
    """The page of a template; program is None for a page of none."""
    replaced = {"SYNOPSIS": synopsis, "COMMANDS": commands, "OPTIONS": options}

    def part(match):
        if match[1].startswith("NOTES "):
            return notes(program, match[1].removeprefix("NOTES "))
        return replaced[match[1]](program)

    page = re.sub(r"^@((?!VERSION)[A-Z]+(?: .+)?)@$", part, template, flags=re.MULTILINE)
    return page.replace("@VERSION@", version)
