"""Installs the build tree into a fresh prefix, moves it, and uses it as other projects would.

    install.py BUILD CONSUMER CMAKE COMPILER FLAGS [TEST...]

BUILD is the build tree, CONSUMER the directory of a project that uses the library. FLAGS are the options without which
a program cannot be linked to the libraries of this build (sanitizers), as one word.
"""

import os
import re
import shutil
import subprocess
import sys
import tempfile
import unittest

BUILD, CONSUMER, CMAKE, COMPILER, FLAGS = sys.argv[1:6]
ANSWER = re.compile(r"version 1\.0, \d+ serializers, krutil:TextBaseEvent: zwölf\n")


def run(*command, **options):
    """Runs a command and returns what it printed; fails with all of that when the command fails."""
    done = subprocess.run(command, stdout=subprocess.PIPE, stderr=subprocess.STDOUT, encoding="utf-8", **options)
    if done.returncode != 0:
        raise AssertionError(f"{' '.join(command)}\nexit code {done.returncode}\n{done.stdout}")
    return done.stdout


def exported(library):
    """Symbols that a shared library defines for others: (kind of nm, demangled name)."""
    lines = run("nm", "--dynamic", "--defined-only", "--demangle", library).splitlines()
    return [(kind, name) for _, kind, name in (line.split(" ", 2) for line in lines)]


class InstalledTree(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        directory = tempfile.TemporaryDirectory()
        cls.addClassCleanup(directory.cleanup)
        first = os.path.join(directory.name, "first")
        cls.prefix = os.path.join(directory.name, "moved")
        cls.scratch = os.path.join(directory.name, "scratch")
        run(CMAKE, "--install", BUILD, "--prefix", first)
        os.rename(first, cls.prefix)
        os.mkdir(cls.scratch)
        library = cls.find("libkrutil_protobuf.so")
        cls.libraries = os.path.dirname(library)

    @classmethod
    def find(cls, name):
        found = [os.path.join(directory, name) for directory, _, names in os.walk(cls.prefix) if name in names]
        if len(found) != 1:
            raise AssertionError(f"{name}: expected once below the prefix, found {found}")
        return found[0]

    def installed(self, *path):
        self.assertTrue(os.path.exists(os.path.join(self.prefix, *path)), os.path.join(*path))

    def uses_the_installed_libraries(self, program):
        loaded = re.findall(r"libkrutil_\w+\.so\S* => (\S+)", run("ldd", program))
        self.assertEqual({os.path.dirname(os.path.realpath(path)) for path in loaded},
                         {os.path.realpath(self.libraries)})

    def test_headers_schema_and_programs_are_where_users_look(self):
        self.installed("include/krutil_protobuf/KrutilProtocol.hpp")
        self.installed("include/krutil_protobuf/krutil.protobuf.EvalIIP.pb.h")
        self.installed("include/krutil_platform/cmddistributor/EvalIIP.hpp")
        self.installed("include/krutil_platform/msg_svc.protobuf.IDType.pb.h")
        self.installed("share/krutil_protobuf/proto/krutil.protobuf.EvalIIP.proto")
        self.installed("share/krutil_platform/proto/msg_svc.protobuf.IDType.proto")
        headers = os.listdir(os.path.join(self.prefix, "include/krutil_protobuf"))
        self.assertEqual([name for name in headers if not name.endswith(".pb.h")], ["KrutilProtocol.hpp"])

    def test_schema_compiles_from_the_installed_files(self):
        protos = os.path.join(self.prefix, "share/krutil_protobuf/proto")
        names = sorted(os.listdir(protos))
        run("protoc", f"-I{protos}", f"-I{self.prefix}/share/krutil_platform/proto",
            f"--descriptor_set_out={self.scratch}/schema", *names)

    def test_no_file_names_the_build_tree_or_the_prefix_it_was_installed_to(self):
        for directory, _, names in os.walk(self.prefix):
            for name in names:
                if name.endswith((".cmake", ".pc", ".h", ".hpp")):
                    with open(os.path.join(directory, name), encoding="utf-8") as file:
                        text = file.read()
                    self.assertNotIn(os.path.realpath(BUILD), text, name)
                    self.assertNotIn(os.path.dirname(self.prefix), text, name)
        for name in ("libkrutil_protobuf.so", "libkrutil_platform.so"):
            paths = re.findall(r"R(?:UN)?PATH.*\[(.*)\]", run("readelf", "--dynamic", self.find(name)))
            self.assertEqual(paths, ["$ORIGIN"], name)

    def test_a_project_builds_with_find_package(self):
        build = os.path.join(self.scratch, "find_package")
        run(CMAKE, "-G", "Ninja", "-S", CONSUMER, "-B", build, f"-DCMAKE_PREFIX_PATH={self.prefix}",
            f"-DCMAKE_CXX_COMPILER={COMPILER}", f"-DCMAKE_CXX_FLAGS={FLAGS}")
        run(CMAKE, "--build", build)
        self.uses_the_installed_libraries(os.path.join(build, "host"))
        self.assertRegex(run(os.path.join(build, "host")), ANSWER)

    def test_a_project_builds_with_pkg_config(self):
        environment = dict(os.environ, PKG_CONFIG_PATH=os.path.join(self.libraries, "pkgconfig"))
        options = run("pkg-config", "--cflags", "--libs", "krutil_protobuf", env=environment).split()
        self.assertIn("-DKRUTIL_PROTOBUF_EXPORT=", options)
        program = os.path.join(self.scratch, "host")
        run(COMPILER, "-std=c++20", *FLAGS.split(), os.path.join(CONSUMER, "host.cpp"), "-o", program, *options,
            f"-Wl,-rpath,{self.libraries}")
        self.uses_the_installed_libraries(program)
        self.assertRegex(run(program), ANSWER)

    @unittest.skipIf(FLAGS, "sanitizers add symbols of their own")
    def test_only_the_protocol_and_the_generated_classes_are_exported(self):
        symbols = exported(self.find("libkrutil_protobuf.so"))
        names = {name for _, name in symbols}
        self.assertIn("krutil::protobuf::KrutilProtocol::init()", names)
        self.assertIn("krutil::protobuf::EvalIIP::EvalIIP(google::protobuf::Arena*, bool)", names)
        self.assertIn("krutil::protobuf::StreamType_IsValid(int)", names)
        protos = os.path.join(self.prefix, "share/krutil_protobuf/proto")
        generated = set()
        for name in os.listdir(protos):
            with open(os.path.join(protos, name), encoding="utf-8") as file:
                generated |= set(re.findall(r"^(?:message|enum) (\w+)", file.read(), re.MULTILINE))
        classes = "|".join(sorted(generated | {"KrutilProtocol"}))
        ours = re.compile(
            # The exported class; generated classes and helpers, their type information and default instances.
            rf"((typeinfo name|typeinfo|vtable) for )?krutil::protobuf::_?({classes})(_\w+|DefaultTypeInternal)?\b"
            # What generated classes specialise.
            rf"|krutil::protobuf::({classes})\* google::protobuf::Arena::CreateMaybeMessage<"
            # Tables of each schema file.
            r"|(descriptor_table|TableStruct)_krutil_2eprotobuf_2e\w+")
        for kind, name in symbols:
            # Weak ones are inline functions of libraries whose headers say that they are visible, and information about
            # types of the language.
            library = kind in "VWu" and re.match(r"(.* for )?(std|boost|google)::|typeinfo (name )?for [^:]+$", name)
            if not ours.match(name) and not library:
                self.fail(f"exported: {kind} {name}")
            self.assertNotIn("protobuf_serializer", name)

    @unittest.skipUnless(os.path.exists(os.path.join(BUILD, "bin/krutil")), "the programs are not built")
    def test_the_programs_run_from_the_prefix(self):
        krutil = os.path.join(self.prefix, "bin/krutil")
        for program in (krutil, os.path.join(self.prefix, "bin/krutil-qvm")):
            self.uses_the_installed_libraries(program)
        self.assertEqual(run(krutil, "eval", "1 + 1", env=dict(os.environ, PATH="/usr/bin:/bin")), "2\n")

    @unittest.skipUnless(os.path.exists(os.path.join(BUILD, "bin/krutil")), "the programs are not built")
    def test_manual_pages_and_completions_are_where_shells_look(self):
        for path in ("share/man/man1/krutil.1", "share/man/man1/krutil-qvm.1", "share/man/man7/krutil-protocol.7",
                     "share/bash-completion/completions/krutil", "share/bash-completion/completions/krutil-qvm",
                     "share/zsh/site-functions/_krutil", "share/fish/vendor_completions.d/krutil.fish"):
            self.installed(path)


if __name__ == "__main__":
    for tool in ("nm", "readelf", "pkg-config", "protoc"):
        if shutil.which(tool) is None:
            sys.exit(f"{tool} is not installed")
    unittest.main(argv=sys.argv[:1] + sys.argv[6:], verbosity=2)
