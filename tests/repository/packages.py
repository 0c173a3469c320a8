"""Checks that the Debian packages are made of what CMake makes: its version, the numbers of its SONAMEs, and the packages
that a build needs.

    packages.py ROOT
"""

import re
import sys

import checkout

LIBRARIES = {
    "libkrutil-platform": "platform/CMakeLists.txt",
    "libkrutil-protobuf": "src/qvm_services/krutil_protobuf/CMakeLists.txt",
}
# Debian has a compiler wherever packages are built.
ALWAYS_THERE = {"g++"}
# What Debian's own tools need besides.
OF_DEBIAN = {"debhelper-compat", "dh-python", "python3-all", "python3-numpy", "python3-setuptools"}


def paragraphs(text):
    """Paragraphs of a control file, as dictionaries of their fields; a line that is neither is an error."""
    found = []
    for paragraph in re.split(r"\n\n+", text.strip("\n")):
        fields = {}
        for line in paragraph.split("\n"):
            field = re.fullmatch(r"([A-Z][\w-]*):(?: (.*))?", line)
            if field:
                name = field[1]
                fields[name] = [field[2] or ""]
            elif line.startswith(" ") and line.strip() and fields:
                fields[name].append(line.strip())
            else:
                raise ValueError(f"neither a field nor the rest of one: {line!r}")
        found.append({name: "\n".join(lines).strip() for name, lines in fields.items()})
    return found


def package_names(relations):
    return {re.match(r"[\w.+-]+", relation.strip())[0] for relation in relations.split(",") if relation.strip()}


def listed(root, name):
    """The packages of one list in scripts/packages.sh."""
    words = re.search(rf"^{name}=\(([^)]*)\)", checkout.read(root, "scripts/packages.sh"), re.MULTILINE)[1]
    return set(re.sub(r"#.*", "", words).split())


def check_version(root):
    version = re.search(r"^project\(\S+ VERSION (\S+)", checkout.read(root, "CMakeLists.txt"), re.MULTILINE)[1]
    packaged = re.match(r"krutil-protobuf \((.*?)\) ", checkout.read(root, "debian/changelog"))
    if not packaged or packaged[1] != version:
        yield (f"debian/changelog: expected version {version}, as CMakeLists.txt has it, got "
               f"{packaged[1] if packaged else 'none'}")


def check_library_names(root, names):
    for library, path in LIBRARIES.items():
        package = library + re.search(r"\bSOVERSION (\d+)", checkout.read(root, path))[1]
        if package not in names:
            yield f"debian/control: expected a package {package}, after the SOVERSION in {path}"


def check_build_packages(root, source):
    packaged = package_names(source["Build-Depends"])
    needed = listed(root, "build_packages") - ALWAYS_THERE
    for package in sorted(needed - packaged):
        yield f"debian/control: Build-Depends lacks {package}, which scripts/packages.sh lists for a build"
    for package in sorted(packaged - needed - OF_DEBIAN):
        yield f"debian/control: Build-Depends has {package}, which scripts/packages.sh does not list for a build"


def check(root):
    try:
        source, *packages = paragraphs(checkout.read(root, "debian/control"))
    except ValueError as error:
        return [f"debian/control: {error}"]
    return [*check_version(root), *check_library_names(root, {package["Package"] for package in packages}),
            *check_build_packages(root, source)]


if __name__ == "__main__":
    checkout.report(check(sys.argv[1]), "Debian packages")
