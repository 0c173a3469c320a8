"""Completions of a program for bash, zsh and fish, from its option table.

In a program with commands, the first word says which command the others belong to.
"""

# The command whose options may stand without a command.
UNNAMED = "repl"

# What a value is, by the name that a help text gives it. Other values are numbers or text, which nobody completes.
FILES = {"FILE", "PATH"}
COMMANDS = {"COMMAND"}


def quoted(text):
    """A word of bash and zsh."""
    return "'" + text.replace("'", "'\\''") + "'"


def takes_files(command):
    """Whether arguments that are no options may be files: those of a name for files, and any of more than one word."""
    return any(positional["name"] in FILES or positional["repeated"] for positional in command["positionals"])


def unnamed(program):
    return next(command for command in program["commands"] if command["name"] == UNNAMED)


def bash(program):
    name = program["name"].replace("-", "_")
    commands = program["commands"]
    lines = [
        f"# Completion of {program['name']} for bash.",
        f"_{name}() {{",
        "    local current=${COMP_WORDS[COMP_CWORD]} option=${COMP_WORDS[COMP_CWORD - 1]} command='' i",
        "    COMPREPLY=()",
        "    # --option=value comes as three words.",
        "    if [[ $current == '=' ]]; then",
        "        current=''",
        "    elif [[ $option == '=' ]]; then",
        "        option=${COMP_WORDS[COMP_CWORD - 2]}",
        "    fi",
    ]
    if commands:
        lines += [
            "    if ((COMP_CWORD > 1)); then",
            "        case ${COMP_WORDS[1]} in",
            f"            -*) command={UNNAMED} ;;",
            "            *) command=${COMP_WORDS[1]} ;;",
            "        esac",
            "    fi",
        ]
    lines += [
        "    # After two dashes there are no options.",
        "    for ((i = 1; i < COMP_CWORD; ++i)); do",
        "        if [[ ${COMP_WORDS[i]} == -- ]]; then",
        "            compopt -o filenames",
        "            mapfile -t COMPREPLY < <(compgen -f -- \"$current\")",
        "            return",
        "        fi",
        "    done",
        "    case \"$command $option\" in",
    ]
    for command in commands or [program]:
        own = command["name"] if commands else ""
        for option in command["options"]:
            if not option["value"]:
                continue
            lines.append("        " + " | ".join(quoted(f"{own} {word}") for word in option["names"]) + ")")
            if option["choices"]:
                lines.append(f"            mapfile -t COMPREPLY < <(compgen -W {quoted(' '.join(option['choices']))} "
                             "-- \"$current\")")
            elif option["value"] in FILES | COMMANDS:
                kind = "-f" if option["value"] in FILES else "-c"
                if option["value"] in FILES:
                    lines.append("            compopt -o filenames")
                lines.append(f"            mapfile -t COMPREPLY < <(compgen {kind} -- \"$current\")")
            lines += ["            return", "            ;;"]
    lines += ["    esac", "    local words=''", "    case $command in"]

    def words(*tables):
        return quoted(" ".join(dict.fromkeys(word for table in tables for option in table["options"]
                                             for word in option["names"] if word.startswith("--"))))

    for command in commands:
        lines.append(f"        {command['name']}) words={words(command)} ;;")
    first = words(program, unnamed(program)) if commands else words(program)
    lines.append(f"        '') words={first} ;;")
    lines += [
        "    esac",
        "    if [[ $current == -* ]]; then",
        "        mapfile -t COMPREPLY < <(compgen -W \"$words\" -- \"$current\")",
        "        return",
        "    fi",
        "    case $command in",
    ]
    if commands:
        names = " ".join(command["name"] for command in commands)
        lines.append(f"        '') mapfile -t COMPREPLY < <(compgen -W {quoted(names)} -- \"$current\") ;;")
    with_files = [command["name"] if commands else "''" for command in commands or [program] if takes_files(command)]
    if with_files:
        lines += [
            f"        {' | '.join(with_files)})",
            "            compopt -o filenames",
            "            mapfile -t COMPREPLY < <(compgen -f -- \"$current\")",
            "            ;;",
        ]
    lines += ["    esac", "}", f"complete -F _{name} {program['name']}", ""]
    return "\n".join(lines)


def zsh_escaped(text):
    """Text of an argument of _arguments."""
    for special in "\\[]:":
        text = text.replace(special, "\\" + special)
    return text


def zsh_arguments(command, indent):
    """The call of _arguments for a command, as lines."""
    parts = []
    for option in command["options"]:
        value = ""
        if option["choices"]:
            value = f":{option['value']}:({' '.join(option['choices'])})"
        elif option["value"] in FILES:
            value = f":{option['value']}:_files"
        elif option["value"] in COMMANDS:
            value = f":{option['value']}:_command_names -e"
        elif option["value"]:
            value = f":{option['value']}: "
        for word in option["names"]:
            equals = "=" if value and word.startswith("--") else ""
            parts.append(quoted(f"{word}{equals}[{zsh_escaped(option['description'])}]{value}"))
    if takes_files(command):
        parts.append("'*:file:_files'")
    return [f"{indent}_arguments -S \\"] + [f"{indent}    {part} \\" for part in parts[:-1]] + [f"{indent}    {parts[-1]}"]


def zsh(program):
    lines = [f"#compdef {program['name']}", f"# Completion of {program['name']} for zsh.", ""]
    commands = program["commands"]
    if not commands:
        return "\n".join(lines + zsh_arguments(program, "") + [""])
    lines += ["if (( CURRENT == 2 )) && [[ $words[2] != -* ]]; then", "    local -a commands=("]
    lines += ["        " + quoted(f"{command['name']}:{command['description']}") for command in commands]
    lines += ["    )", "    _describe command commands", "    return", "fi", "local command=$words[2]"]
    lines += ["if [[ $command == -* ]]; then", f"    command={UNNAMED}", "else", "    shift words",
              "    (( CURRENT-- ))", "fi", "case $command in"]
    for command in commands:
        own = command
        if command["name"] == UNNAMED:
            extra = [option for option in program["options"] if option not in command["options"]]
            own = {**command, "options": command["options"] + extra}
        lines += [f"    {command['name']})"] + zsh_arguments(own, "        ") + ["        ;;"]
    return "\n".join(lines + ["esac", ""])


def fish_option(program, option, condition):
    parts = [f"complete -c {program['name']}"] + ([f"-n {condition}"] if condition else [])
    for word in option["names"]:
        parts.append(f"-l {word[2:]}" if word.startswith("--") else f"-s {word[1:]}")
    if option["choices"]:
        parts.append(f"-x -a {fish_quoted(' '.join(option['choices']))}")
    elif option["value"] in FILES:
        parts.append("-r -F")
    elif option["value"] in COMMANDS:
        parts.append("-x -a '(__fish_complete_command)'")
    elif option["value"]:
        parts.append("-x")
    return " ".join(parts + [f"-d {fish_quoted(option['description'])}"])


def fish_quoted(text):
    return "'" + text.replace("\\", "\\\\").replace("'", "\\'") + "'"


def fish(program):
    name = program["name"]
    commands = program["commands"]
    lines = [f"# Completion of {name} for fish.", f"complete -c {name} -f"]
    if not commands:
        return "\n".join(lines + [fish_option(program, option, "") for option in program["options"]] + [""])
    function = "__" + name.replace("-", "_") + "_command"
    lines += [
        "",
        f"# Prints the command that the words belong to: none for the first word, unless that is an option of {UNNAMED}.",
        f"function {function}",
        "    set -l before (commandline -opc)",
        "    set -l words $before (commandline -ct)",
        "    if string match -q -- '-*' \"$words[2]\"",
        f"        echo {UNNAMED}",
        "    else",
        "        echo \"$before[2]\"",
        "    end",
        "end",
        "",
    ]
    none = f"'test -z \"$({function})\"'"
    for command in commands:
        lines.append(f"complete -c {name} -n {none} -a {command['name']} -d {fish_quoted(command['description'])}")
    before = "'test (count (commandline -opc)) -eq 1'"
    lines += [fish_option(program, option, before) for option in program["options"]
              if option not in unnamed(program)["options"]]
    for command in commands:
        condition = f"'test \"$({function})\" = {command['name']}'"
        if takes_files(command):
            lines.append(f"complete -c {name} -n {condition} -F")
        lines += [fish_option(program, option, condition) for option in command["options"]]
    return "\n".join(lines + [""])
