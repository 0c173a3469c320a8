"""What lies below the prefix, and that nothing of it is bound to a place."""

import os
import re
import tempfile
import unittest

from tree import BUILD, CHECKOUT, LIBRARIES, PREFIX, find, library_directory, loaded_libraries, main, run


class Layout(unittest.TestCase):
    def installed(self, *path):
        self.assertTrue(os.path.exists(os.path.join(PREFIX, *path)), os.path.join(*path))

    def test_headers_schema_and_programs_are_where_users_look(self):
        self.installed("include/krutil_protobuf/KrutilProtocol.hpp")
        self.installed("include/krutil_protobuf/krutil.protobuf.EvalIIP.pb.h")
        self.installed("include/krutil_platform/cmddistributor/EvalIIP.hpp")
        self.installed("include/krutil_platform/msg_svc.protobuf.IDType.pb.h")
        self.installed("share/krutil_protobuf/proto/krutil.protobuf.EvalIIP.proto")
        self.installed("share/krutil_protobuf/krutil_protobuf.desc")
        self.installed("share/krutil_platform/proto/msg_svc.protobuf.IDType.proto")
        headers = os.listdir(os.path.join(PREFIX, "include/krutil_protobuf"))
        self.assertEqual([name for name in headers if not name.endswith(".pb.h")], ["KrutilProtocol.hpp"])

    def test_schema_compiles_from_the_installed_files_to_the_installed_descriptor_set(self):
        protos = os.path.join(PREFIX, "share/krutil_protobuf/proto")
        with tempfile.TemporaryDirectory() as scratch:
            compiled = os.path.join(scratch, "schema")
            run("protoc", f"-I{protos}", f"-I{PREFIX}/share/krutil_platform/proto", "--include_imports",
                f"--descriptor_set_out={compiled}", *sorted(os.listdir(protos)))
            with open(compiled, "rb") as ours, open(find("krutil_protobuf.desc"), "rb") as installed:
                self.assertEqual(ours.read(), installed.read())

    def test_no_file_names_the_build_tree_or_the_prefix_it_was_installed_to(self):
        for directory, _, names in os.walk(PREFIX):
            for name in names:
                if name.endswith((".cmake", ".pc", ".h", ".hpp")):
                    with open(os.path.join(directory, name), encoding="utf-8") as file:
                        self.assertNotIn(os.path.realpath(BUILD), file.read(), name)
        for name in LIBRARIES:
            paths = re.findall(r"R(?:UN)?PATH.*\[(.*)\]", run("readelf", "--dynamic", find(name)))
            self.assertEqual(paths, ["$ORIGIN"], name)

    def test_components_install_alone(self):
        with tempfile.TemporaryDirectory() as scratch:
            run("cmake", "--install", BUILD, "--prefix", scratch, "--component", "schema")
            self.assertEqual(sorted(os.listdir(scratch)), ["lib", "share"])
            self.assertEqual(sorted(os.listdir(os.path.join(scratch, "lib/cmake/krutil_protobuf"))),
                             ["krutil_protobufConfig.cmake", "krutil_protobufConfigVersion.cmake"])

    def test_each_file_belongs_to_a_debian_package(self):
        directory = os.path.join(CHECKOUT, "debian")
        patterns = []
        for name in os.listdir(directory):
            if name.endswith(".install") and not name.startswith("python3-"):
                with open(os.path.join(directory, name), encoding="utf-8") as file:
                    patterns += [(name, pattern) for pattern in file.read().split()]
        for place, _, names in os.walk(PREFIX):
            for name in names:
                path = os.path.join("usr", os.path.relpath(os.path.join(place, name), PREFIX))
                # Debian has libraries in a directory for each architecture.
                path = re.sub("^usr/lib/", "usr/lib/any/", path)
                owners = {owner for owner, pattern in patterns
                          if re.match(pattern.replace(".", r"\.").replace("*", "[^/]*") + "(/|$)", path)}
                self.assertEqual(len(owners), 1, f"{path}: expected in one file debian/*.install, got {sorted(owners)}")

    @unittest.skipUnless(os.path.exists(os.path.join(BUILD, "bin/krutil")), "the programs are not built")
    def test_the_programs_run_from_the_prefix(self):
        krutil = os.path.join(PREFIX, "bin/krutil")
        for program in (krutil, os.path.join(PREFIX, "bin/krutil-qvm")):
            self.assertEqual(loaded_libraries(program), {os.path.realpath(library_directory())})
        self.assertEqual(run(krutil, "eval", "1 + 1", env=dict(os.environ, PATH="/usr/bin:/bin")), "2\n")

    @unittest.skipUnless(os.path.exists(os.path.join(BUILD, "bin/krutil")), "the programs are not built")
    def test_manual_pages_completions_and_schema_are_where_programs_look(self):
        for path in ("share/man/man1/krutil.1", "share/man/man1/krutil-qvm.1",
                     "share/man/man5/krutil-recording.5", "share/man/man7/krutil-protocol.7",
                     "share/bash-completion/completions/krutil", "share/bash-completion/completions/krutil-qvm",
                     "share/zsh/site-functions/_krutil", "share/fish/vendor_completions.d/krutil.fish",
                     "share/krutil/krutil-events.schema.json", "share/krutil/krutil-inspect.schema.json",
                     "share/wireshark/protobuf/krutil.protobuf.EvalIIP.proto",
                     "share/wireshark/protobuf/msg_svc.protobuf.IDType.proto",
                     "share/doc/krutil/examples/systemd/krutil-qvm@.socket"):
            self.installed(path)
        self.assertTrue(os.path.exists(os.path.join(library_directory(), "wireshark/plugins/krutil.lua")))


if __name__ == "__main__":
    main("readelf", "protoc")
