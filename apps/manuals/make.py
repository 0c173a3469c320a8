"""Makes the manual pages and the completions of the programs.

    make.py TABLES VERSION OUTPUT TEMPLATE...

TABLES is what krutil_option_tables prints. Each TEMPLATE is a manual page, such as krutil.1.in: its text is written by
hand, and what the option tables know is put in the place of words in capitals (see man_page.py). Everything is written
to the directory OUTPUT.
"""

import json
import os
import sys

import completions
import man_page


def write(directory, name, text):
    with open(os.path.join(directory, name), "w", encoding="utf-8") as file:
        file.write(text)


def make(tables, version, output, templates):
    with open(tables, encoding="utf-8") as file:
        programs = {program["name"]: program for program in json.load(file)}
    for template in templates:
        page = os.path.basename(template).removesuffix(".in")
        with open(template, encoding="utf-8") as file:
            write(output, page, man_page.fill(file.read(), programs.get(page.rsplit(".", 1)[0]), version))
    for name, program in programs.items():
        write(output, f"{name}.bash", completions.bash(program))
        write(output, f"_{name}", completions.zsh(program))
        write(output, f"{name}.fish", completions.fish(program))


if __name__ == "__main__":
    make(*sys.argv[1:4], sys.argv[4:])
