"""What the installed libraries export, symbol by symbol, and what the product needs of the system.

The symbols files of the Debian packages list what is exported, and since which version. With --record they are written
anew; the target krutil_record_exports does that.
"""

import os
import re
import sys
import unittest

from tree import CHECKOUT, COMPARE_WITH_RECORDED, LIBRARIES, LINK_FLAGS, find, main, run

# What C has for the product: its memory, its environment variable, and what each C++ program needs.
OF_C = re.compile(r"__cxa_\w+|_ITM_\w+|__gmon_start__|_Unwind_Resume|__dynamic_cast|__gxx_personality_v0|__tls_get_addr"
                  r"|__libc_single_threaded|__once_proxy|pthread_once|__stack_chk_fail|__\w+_chk|getenv"
                  r"|mem(cpy|move|set|cmp)|bcmp|str(len|cmp)|descriptor_table_msg_5fsvc_\w+")
# C++ functions that are about threads or files; std::once_flag and std::call_once are not among them.
OF_THREADS_OR_FILES = re.compile(r"\bstd::(jthread|thread|this_thread|async|mutex|condition_variable|filesystem)\b"
                                 r"|\bstd::basic_(filebuf|[io]?fstream)\b|\bstd::__basic_file\b"
                                 r"|\bgoogle::protobuf::io::(File|Ostream|Istream)|\bboost::asio\b")


def symbols(library, which):
    """(kind of nm, demangled name) of the symbols that a library defines for others, or needs of others."""
    lines = run("nm", "--dynamic", which, "--demangle", library).splitlines()
    return {tuple(re.sub("^[0-9a-f]{16}", "", line).strip().split(" ", 1)) for line in lines}


def exported(name):
    """Names of what a library exports, sorted. Inline functions of exported classes (W) are left out: whoever calls them
    has them from the header, and compilers differ in which of them they keep."""
    return sorted({symbol for kind, symbol in symbols(find(name), "--defined-only") if kind != "W"})


# A line about one symbol: its name, as C++ has it or as it is, and the version that exported it first.
LISTED = re.compile(r"^ (?:\(c\+\+\)\"(.*)@Base\"|(\w+)@Base) (\S+)$", re.MULTILINE)


def symbols_file(name):
    soname = re.search(r"SONAME.*\[(\w+)\.so\.(\d+)\]", run("readelf", "--dynamic", find(name)))
    return os.path.join(CHECKOUT, "debian", f"{soname[1].replace('_', '-')}{soname[2]}.symbols")


def listed(text):
    """Versions by name."""
    return {match[1] or match[2]: match[3] for match in LISTED.finditer(text)}


def record(name):
    with open(symbols_file(name), encoding="utf-8") as file:
        text = file.read()
    with open(os.path.join(CHECKOUT, "CMakeLists.txt"), encoding="utf-8") as file:
        new = re.search(r"^project\(\S+ VERSION (\S+)", file.read(), re.MULTILINE)[1]
    versions = listed(text)
    lines = []
    for symbol in exported(name):
        quoted = f"{symbol}@Base" if re.fullmatch(r"\w+", symbol) else f'(c++)"{symbol}@Base"'
        lines.append(f" {quoted} {versions.get(symbol, new)}\n")
    with open(symbols_file(name), "w", encoding="utf-8") as file:
        file.write(re.sub(LISTED.pattern + "\n", "", text, flags=re.MULTILINE) + "".join(lines))


@unittest.skipIf(LINK_FLAGS, "sanitizers add symbols of their own")
class Symbols(unittest.TestCase):
    maxDiff = None

    @unittest.skipUnless(COMPARE_WITH_RECORDED, "the lists are those of an optimised build with GCC")
    def test_exactly_the_recorded_symbols_are_exported(self):
        for name in LIBRARIES:
            with open(symbols_file(name), encoding="utf-8") as file:
                expected = set(listed(file.read()))
            now = set(exported(name))
            self.assertEqual((sorted(now - expected), sorted(expected - now)), ([], []),
                             f"{name} exports (more, less) than {symbols_file(name)} says. What is meant to change is "
                             "stated in the library's exports.map and recorded by the target krutil_record_exports")

    def test_nothing_of_other_libraries_is_exported(self):
        for name in LIBRARIES:
            for kind, symbol in symbols(find(name), "--defined-only"):
                of_others = re.match(r"((typeinfo|vtable|guard variable)( name)? for )?(std|boost|google|__gnu_cxx)::", symbol)
                self.assertFalse(of_others or kind == "u", f"{name}: {kind} {symbol}")

    def test_the_product_needs_no_sockets_threads_or_files(self):
        for kind, symbol in symbols(find("libkrutil_protobuf.so"), "--undefined-only"):
            name = symbol.split("@")[0]
            if "::" in name or name.startswith(("operator ", "typeinfo ", "vtable ")):
                self.assertNotRegex(name, OF_THREADS_OR_FILES)
            else:
                self.assertRegex(name, rf"^({OF_C.pattern})$", "is not among what the product may need of C")

    def test_libraries_stay_loaded(self):
        for name in LIBRARIES:
            self.assertRegex(run("readelf", "--dynamic", find(name)), r"FLAGS_1\).* NODELETE\b", name)


if __name__ == "__main__":
    if sys.argv[1:] == ["--record"]:
        for library in LIBRARIES:
            record(library)
    else:
        main("nm", "readelf")
