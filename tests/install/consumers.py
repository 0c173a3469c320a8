"""Builds other projects against the installed tree, in each way that users have, and with both compilers where these could
differ. None of the projects sets a language level for CMake: that comes with the targets."""

import os
import re
import tempfile
import unittest

from tree import CHECKOUT, COMPILERS, LINK_FLAGS, PREFIX, PROJECTS, library_directory, loaded_libraries, main, run

HOST = os.path.join(PROJECTS, "host")
ANSWER = re.compile(r"version 1\.0, \d+ serializers, krutil:TextBaseEvent: zwölf\n")


def pkg_config(*options):
    environment = dict(os.environ, PKG_CONFIG_PATH=os.path.join(library_directory(), "pkgconfig"))
    return run("pkg-config", *options, env=environment).split()


class Consumers(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        directory = tempfile.TemporaryDirectory()
        cls.addClassCleanup(directory.cleanup)
        cls.scratch = directory.name

    def configure(self, project, build, *definitions):
        build = os.path.join(self.scratch, build)
        return build, run("cmake", "-G", "Ninja", "-S", project, "-B", build, *definitions)

    def works(self, program):
        self.assertEqual(loaded_libraries(program), {os.path.realpath(library_directory())})
        self.assertRegex(run(program), ANSWER)

    def test_a_project_builds_with_find_package(self):
        for compiler in COMPILERS:
            with self.subTest(compiler):
                build, _ = self.configure(HOST, f"package-{os.path.basename(compiler)}", f"-DCMAKE_PREFIX_PATH={PREFIX}",
                                          f"-DCMAKE_CXX_COMPILER={compiler}", f"-DCMAKE_CXX_FLAGS={LINK_FLAGS}")
                run("cmake", "--build", build)
                self.works(os.path.join(build, "host"))

    def test_a_project_builds_with_pkg_config(self):
        options = pkg_config("--cflags", "--libs", "krutil_protobuf")
        self.assertIn("-DKRUTIL_PROTOBUF_EXPORT=", options)
        self.assertNotIn("-licuuc", options)
        program = os.path.join(self.scratch, "host-pkg-config")
        run(COMPILERS[-1], "-std=c++20", *LINK_FLAGS.split(), os.path.join(HOST, "host.cpp"), "-o", program, *options,
            f"-Wl,-rpath,{library_directory()}")
        self.works(program)

    def test_a_project_compiles_with_the_sources_below_its_own(self):
        # The library itself is built that way, as a whole, by the tests of the foreign platform.
        build, _ = self.configure(HOST, "sources", f"-DKRUTIL_CHECKOUT={CHECKOUT}", f"-DCMAKE_CXX_COMPILER={COMPILERS[-1]}")
        run("cmake", "--build", build, "--target", "CMakeFiles/host.dir/host.cpp.o")
        with open(os.path.join(build, "CMakeCache.txt"), encoding="utf-8") as cache:
            self.assertIn("CMAKE_BUILD_TYPE:STRING=\n", cache.read(), "the build type is the host's to choose")

    def test_a_schema_that_imports_the_workspace_messages_exchanges_what_the_document_shows(self):
        build, _ = self.configure(os.path.join(PROJECTS, "workspace"), "workspace", f"-DCMAKE_PREFIX_PATH={PREFIX}",
                                  f"-DCMAKE_CXX_COMPILER={COMPILERS[0]}", f"-DCMAKE_CXX_FLAGS={LINK_FLAGS}")
        run("cmake", "--build", build)
        with open(os.path.join(CHECKOUT, "docs/protocol.md"), encoding="utf-8") as document:
            section = document.read().split("\n## Messages without a serializer\n")[1]
        [shown] = re.findall(r"^```\n(.*?)^```\n", section, re.MULTILINE | re.DOTALL)
        self.assertEqual(run(os.path.join(build, "workspace")), shown)

    def test_plug_ins_are_unloaded_and_loaded_again(self):
        # Loading the messages twice ends the process: "File already exists in database".
        said = {name: f'{name}: 8 bytes, known, text: "hello"\n' for name in ("libreader.so", "libwriter.so")}
        order = ("libreader.so", "libreader.so", "libwriter.so", "libreader.so", "libwriter.so", "libreader.so")
        for compiler in COMPILERS:
            with self.subTest(compiler):
                build, _ = self.configure(os.path.join(PROJECTS, "plugins"), f"plugins-{os.path.basename(compiler)}",
                                          f"-DCMAKE_PREFIX_PATH={PREFIX}", f"-DCMAKE_CXX_COMPILER={compiler}",
                                          f"-DCMAKE_CXX_FLAGS={LINK_FLAGS}")
                run("cmake", "--build", build)
                plugins = [os.path.join(build, name) for name in said]
                self.assertEqual(run(os.path.join(build, "plugin_host"), *plugins),
                                 "".join(said[name] for name in order) + "left\n")
                # Generated code is in the library alone, however many use it.
                for image in (*plugins, os.path.join(build, "plugin_host")):
                    self.assertNotRegex(run("nm", "--defined-only", image), r"descriptor_table_(krutil|msg_5fsvc)_")

    def test_the_schema_and_the_programs_are_found_without_a_compiler(self):
        _, said = self.configure(os.path.join(PROJECTS, "components"), "components", f"-DCMAKE_PREFIX_PATH={PREFIX}",
                                 "-DWANTED=schema;tools")
        share = os.path.realpath(os.path.join(PREFIX, "share"))
        self.assertIn(f"-- schema: {share}/krutil_protobuf/proto;{share}/krutil_platform/proto\n", said)
        self.assertIn(f"-- descriptor set: {share}/krutil_protobuf/krutil_protobuf.desc\n", said)
        for program in ("krutil", "krutil-qvm"):
            self.assertIn(f"-- {program}: {os.path.realpath(PREFIX)}/bin/{program}\n", said)

    def test_an_unknown_component_is_refused(self):
        with self.assertRaisesRegex(AssertionError, "krutil_protobuf_FOUND to FALSE"):
            self.configure(os.path.join(PROJECTS, "components"), "unknown", f"-DCMAKE_PREFIX_PATH={PREFIX}",
                           "-DWANTED=schema;nothing")

    def test_pkg_config_knows_where_the_schema_is(self):
        share = os.path.realpath(os.path.join(PREFIX, "share"))
        for package, variable, path in (("krutil_protobuf", "protodir", "krutil_protobuf/proto"),
                                        ("krutil_protobuf", "descriptor_set", "krutil_protobuf/krutil_protobuf.desc"),
                                        ("krutil_platform", "protodir", "krutil_platform/proto")):
            [said] = pkg_config(f"--variable={variable}", package)
            self.assertEqual(os.path.realpath(said), os.path.join(share, path))
            self.assertTrue(os.path.exists(said), said)


if __name__ == "__main__":
    main("cmake", "ninja", "ldd", "nm", "pkg-config")
