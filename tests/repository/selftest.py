"""Plants one violation of each rule in a small checkout and expects it to be found, and nothing else."""

import os
import tempfile
import unittest

import documents
import headers
import includes
import packages
import texts
import wording


class Planted(unittest.TestCase):
    def setUp(self):
        directory = tempfile.TemporaryDirectory()
        self.addCleanup(directory.cleanup)
        self.root = directory.name
        self.write("platform/include/io/Text.hpp", "// Text.\n#pragma once\nnamespace io {\n}\n")
        for name in includes.HOST_ONLY:
            self.write(f"platform/include/{name}", "// The host's own.\n")
        self.write("platform/src/io/Detail.hpp", '#include "io/Text.hpp"\n')
        self.write(f"{includes.PRODUCT}/KrutilProtocol.hpp", '#include "io/Text.hpp"\n')
        self.write(f"{includes.PRODUCT}/Framing.hpp", "// Framing.\n")
        self.write("apps/common/Build.hpp", "// Build.\n")
        self.write(includes.PORTING, "| `io/Text.hpp` | texts |\n")

    def write(self, path, text):
        file = os.path.join(self.root, path)
        os.makedirs(os.path.dirname(file), exist_ok=True)
        with open(file, "w", encoding="utf-8") as stream:
            stream.write(text)


class IncludesTest(Planted):
    def expect(self, path, line, *parts):
        self.assertEqual(includes.check(self.root), [])
        self.write(path, f"// First line.\n{line}\n")
        findings = includes.check(self.root)
        self.assertEqual(len(findings), 1, findings)
        for part in (f"{path}:2:", *parts):
            self.assertIn(part, findings[0])

    def test_arrows_that_are_allowed_are_not_found(self):
        self.write(f"{includes.PRODUCT}/A.cpp", '#include "Framing.hpp"\n#include "io/Text.hpp"\n#include <vector>\n')
        self.write("apps/qvm/B.cpp", '#include "KrutilProtocol.hpp"\n#include "krutil.protobuf.IIP.pb.h"\n')
        self.write("apps/qvm/C.cpp", '#include "common/Build.hpp"\n#include "msg_svc.protobuf.IDType.pb.h"\n')
        self.write("tests/D.cpp", '#include "Framing.hpp"\n#include "platform/src/io/Detail.hpp"\n')
        self.assertEqual(includes.check(self.root), [])

    def test_platform_includes_product(self):
        self.expect("platform/src/io/Text.cpp", '#include "Framing.hpp"', "platform/src", "Framing.hpp of product")

    def test_platform_includes_product_through_a_relative_path(self):
        self.expect("platform/src/A.cpp", f'#include "../../{includes.PRODUCT}/Framing.hpp"', "of product")

    def test_platform_includes_generated_messages_of_the_product(self):
        self.expect("platform/src/A.cpp", '#include "krutil.protobuf.IIP.pb.h"', "of product/generated")

    def test_platform_includes_apps(self):
        self.expect("platform/include/io/A.hpp", '#include "common/Build.hpp"', "of apps")

    def test_platform_interface_includes_platform_implementation(self):
        self.expect("platform/include/io/A.hpp", '#include "io/Detail.hpp"', "of platform/src")

    def test_product_includes_platform_implementation(self):
        self.expect(f"{includes.PRODUCT}/A.cpp", '#  include "io/Detail.hpp"', "of platform/src")

    def test_product_includes_what_only_the_reference_host_has(self):
        line = '#include "foundation/core/diag/AssertionSwitch.hpp"'
        self.expect(f"{includes.PRODUCT}/A.cpp", line, "reference host's own")

    def test_product_includes_what_the_page_for_platforms_does_not_list(self):
        self.write("platform/include/io/Word.hpp", "// Word.\n")
        self.expect(f"{includes.PRODUCT}/A.cpp", '#include "io/Word.hpp"', "docs/porting.md does not list io/Word.hpp")

    def test_page_for_platforms_lists_what_the_product_does_not_include(self):
        self.write(includes.PORTING, "| `io/Text.hpp` | texts |\n| `io/Word.hpp` | words |\n| `io/Text.hpp` | texts |\n")
        self.assertEqual(includes.check(self.root), ["docs/porting.md: the product does not include io/Word.hpp",
                                                     "docs/porting.md: io/Text.hpp twice"])

    def test_header_of_the_reference_host_that_is_gone(self):
        name = sorted(includes.HOST_ONLY)[0]
        os.remove(os.path.join(self.root, "platform/include", name))
        self.assertEqual(includes.check(self.root),
                         [f"tests/repository/includes.py: HOST_ONLY names {name}, which does not exist"])

    def test_product_includes_apps(self):
        self.expect(f"{includes.PRODUCT}/A.cpp", "#include <common/Build.hpp>", "of apps")

    def test_apps_include_the_inside_of_the_product(self):
        self.expect("apps/qvm/A.cpp", '#include "Framing.hpp"', "of product")

    def test_apps_include_platform_implementation(self):
        self.expect("apps/qvm/A.cpp", '#include "io/Detail.hpp"', "of platform/src")

    def test_program_includes_the_other_program(self):
        self.write("apps/krutil/base/A.hpp", "// A.\n")
        self.expect("apps/qvm/A.cpp", '#include "krutil/base/A.hpp"', "apps/qvm must not include", "of apps/krutil")

    def test_lower_room_includes_an_upper_one(self):
        self.write("apps/krutil/commands/A.hpp", "// A.\n")
        self.expect("apps/krutil/base/B.cpp", '#include "krutil/commands/A.hpp"', "in a room above")

    def test_upper_room_includes_a_lower_one(self):
        self.write("apps/qvm/process/A.hpp", "// A.\n")
        self.write("apps/qvm/python/B.cpp", '#include "qvm/process/A.hpp"\n')
        self.write("apps/qvm/C.cpp", '#include "qvm/process/A.hpp"\n')
        self.assertEqual(includes.check(self.root), [])

    def test_room_that_is_not_listed(self):
        self.expect("apps/qvm/attic/A.cpp", '#include "common/Build.hpp"', "in no room of apps/qvm")

    def test_session_layer_includes_what_one_protocol_is_about(self):
        self.write("platform/include/krutil/io/Text.hpp", "// Text.\n")
        line = '#include "krutil/io/Text.hpp"'
        self.write("platform/src/foundation/korveldata/A.cpp", line + "\n")
        self.expect(f"platform/src/{includes.SESSION_LAYER}A.cpp", line, "serves any protocol")

    def test_session_layer_includes_what_one_protocol_is_about_in_an_interface(self):
        self.write("platform/include/krutil/io/Text.hpp", "// Text.\n")
        self.expect(f"platform/include/{includes.SESSION_LAYER}A.hpp", '#include "krutil/io/Text.hpp"', "any protocol")

    def test_included_file_that_is_nowhere(self):
        self.expect("apps/qvm/A.cpp", '#include "io/Missing.hpp"', "in no room")


class HeadersTest(unittest.TestCase):
    GOOD = "// Purpose.\n#pragma once\n\nnamespace krutil::io {\nclass Text;\n}\n"

    def findings(self, text):
        return headers.check_shape("platform/include/krutil/io/Text.hpp", text)

    def test_a_header_in_order_is_not_found(self):
        self.assertEqual(self.findings(self.GOOD), [])

    def test_no_opening_comment(self):
        self.assertIn("opens with a comment", self.findings(self.GOOD.replace("// Purpose.\n", ""))[0])

    def test_no_include_guard(self):
        self.assertIn("#pragma once", self.findings(self.GOOD.replace("#pragma once", ""))[0])

    def test_another_namespace_than_the_path_names(self):
        self.assertIn("namespace krutil::io", self.findings(self.GOOD.replace("krutil::io", "krutil::ios"))[0])


class HeadersCompileTest(Planted):
    def test_a_header_that_needs_another_one_before_it(self):
        self.write("platform/include/io/Alone.hpp", "#pragma once\n#include <string>\nstd::string text();\n")
        self.write("platform/include/io/Needy.hpp", "#pragma once\nstd::string text();\n")
        command = ["c++", "-fsyntax-only", "-x", "c++"]
        self.assertEqual(headers.check_alone(self.root, "platform/include/io/Alone.hpp", command, self.root), [])
        findings = headers.check_alone(self.root, "platform/include/io/Needy.hpp", command, self.root)
        self.assertIn("Needy.hpp does not compile on its own", findings[0])


class WordingTest(unittest.TestCase):
    def test_text_that_stands_on_its_own_is_not_found(self):
        for text in ("a special part of it", "an unspecified order",
                     "the special case", "a spec of an array", "see docs/architecture.md", "#!/usr/bin/python3",
                     "and/or/not", "https://example.org/a/b", "mkdir -p /tmp/krutil/x", "a / b / c", "part of 2"):
            self.assertEqual(wording.check_text("file", text), [], text)

    def test_pointers_that_lead_nowhere(self):
        # Put together here, because this file is checked as well.
        for text in ("the sp" + "ec says", "Sp" + "ecification", "see Pa" + "rt 7.3", "fixes iss" + "ue 12",
                     "tick" + "et #4", '"/ow' + 'n/file"', "in /own" + "/file"):
            self.assertEqual(len(wording.check_text("file", f"a\n{text}")), 1, text)


class DocumentsTest(Planted):
    def test_promises_that_are_kept_are_not_found(self):
        self.write("docs/other.md", "# Some heading, here\n")
        self.write("README.md", "# Top\n[a](docs/other.md#some-heading-here) [b](#top) [c](https://example.org/x)\n")
        self.assertEqual(documents.check(self.root), [])

    def test_link_to_a_file_that_is_not_there(self):
        self.write("docs/a.md", "[x](b.md)\n")
        self.assertEqual(documents.check(self.root), ["docs/a.md: link to b.md, which does not exist"])

    def test_link_to_a_heading_that_is_not_there(self):
        self.write("docs/a.md", "# One\n[x](#two)\n")
        self.assertEqual(documents.check(self.root), ["docs/a.md: link to #two, but docs/a.md has no such heading"])

    def test_script_that_is_not_there(self):
        self.write("README.md", "```sh\n./scripts/nothing\n```\n")
        self.assertEqual(documents.check(self.root), ["README.md: ./scripts/nothing is not there or cannot be run"])

    def test_quotation_that_the_source_has_outgrown(self):
        self.write(documents.QUOTED_FROM, "int one();\nint two();\n")
        self.write("README.md", "```cpp\nint two();\n```\n")
        self.assertEqual(documents.check(self.root), [])
        self.write("README.md", "```cpp\nint three();\n```\n")
        self.assertEqual(documents.check(self.root), [f"README.md: its C++ is not what {documents.QUOTED_FROM} says"])

    def test_document_that_only_a_source_knows(self):
        self.write("apps/common/A.cpp", "// See docs/lost.md.\n")
        self.assertEqual(documents.check(self.root), ["apps/common/A.cpp: mentions docs/lost.md, which does not exist"])

    def test_message_that_the_page_of_the_messages_leaves_out(self):
        self.write(documents.SCHEMA + "a.Text.proto", "// message Comment\nmessage Text {\n    message Inner {}\n}\n")
        self.write(documents.MESSAGES, "### Text\n")
        self.assertEqual(documents.check(self.root), [])
        self.write(documents.MESSAGES, "### TextEvent\n")
        self.assertEqual(documents.check(self.root),
                         ["docs/protocol.md: nothing about Text, which " + documents.SCHEMA + "a.Text.proto defines"])

    def test_subcommand_that_the_client_lacks(self):
        self.write("README.md", "```sh\nkrutil nothing 1\n```\n")
        self.assertEqual(documents.check(self.root, "/bin/false"), ["README.md: krutil has no subcommand nothing"])
        self.assertEqual(documents.check(self.root, "/bin/true"), [])


class TextsTest(Planted):
    WIRE = "# Wire\n\n| text | the cause |\n|---|---|\n| frame N: expected a tag, got X bytes | too long |\n"
    SAYS = 'refuse("frame " + name(1), std::string("a tag"), to_string(x) + " bytes");\n'
    FAILURES = '| failure | side | reaction |\n|---|---|---|\n| no id | read | `std::logic_error` "No id in it." |\n'
    THROWS = 'require(has, "No id "\n        "in it.");  // "Not said."\nfatal("A", "void a(int b)");\n'
    TESTS = 'EXPECT_EQ(a, "frame 1: expected a tag, "\n     "got 12 bytes");\nEXPECT_EQ(b, R"(No id in it.)");\n'

    def setUp(self):
        super().setUp()
        self.write("docs/session-wire.md", self.WIRE)
        self.write("docs/protocol.md", self.FAILURES)
        self.write(texts.SESSION + "Reader.cpp", self.SAYS)
        self.write(texts.CONVERSIONS + "A.cpp", self.THROWS)
        self.write("tests/platform/ReaderTest.cpp", self.TESTS)

    def expect(self, path, text, finding):
        self.assertEqual(texts.check(self.root), [])
        self.write(path, text)
        self.assertEqual(texts.check(self.root), [finding])

    def test_listed_violation_that_no_test_expects(self):
        self.expect("docs/session-wire.md", self.WIRE + "| frame N: expected a word | |\n",
                    'docs/session-wire.md: no test expects "frame N: expected a word"')

    def test_violation_that_is_not_listed(self):
        self.expect(texts.SESSION + "Other.cpp", 'throw ProtocolViolation(what(a) + "got no tag");\n',
                    f'{texts.SESSION}Other.cpp: docs/session-wire.md and docs/protocol.md do not list "got no tag"')

    def test_violation_of_a_function_that_says_them(self):
        self.expect(texts.SESSION + "Other.cpp", 'std::string refusalToReceive(int a) {\n    return "no frame";\n}\n',
                    f'{texts.SESSION}Other.cpp: docs/session-wire.md and docs/protocol.md do not list "no frame"')

    def test_other_texts_of_the_session_are_not_looked_at(self):
        self.write(texts.SESSION + "Other.cpp", 'throw std::logic_error("no such session");\n')
        self.assertEqual(texts.check(self.root), [])

    def test_listed_failure_that_no_test_expects(self):
        self.expect("docs/protocol.md", self.FAILURES + '| no name | read | `std::logic_error` "No name." |\n',
                    'docs/protocol.md: no test expects "No name."')

    def test_failure_that_is_not_listed(self):
        self.expect(texts.CONVERSIONS + "B.hpp", 'throw std::logic_error("No name in it.");\n',
                    f'{texts.CONVERSIONS}B.hpp: docs/protocol.md does not have "No name in it."')


class PackagesTest(Planted):
    CONTROL = ("Source: krutil-protobuf\nBuild-Depends:\n cmake (>= 3.25),\n debhelper-compat (= 13),\n libicu-dev,\n\n"
               "Package: libkrutil-platform0\n\nPackage: libkrutil-protobuf0\nDescription: text\n more text\n")
    BUILD = "build_packages=(\n    g++ cmake\n    libicu-dev  # text\n)\n"

    def setUp(self):
        super().setUp()
        self.write("CMakeLists.txt", "project(krutil_protobuf VERSION 0.1.0 LANGUAGES CXX)\n")
        for path in packages.LIBRARIES.values():
            self.write(path, "set_target_properties(a PROPERTIES SOVERSION 0)\n")
        self.write("scripts/packages.sh", self.BUILD)
        self.write("debian/changelog", "krutil-protobuf (0.1.0) unstable; urgency=medium\n")
        self.write("debian/control", self.CONTROL)

    def expect(self, path, text, finding):
        self.assertEqual(packages.check(self.root), [])
        self.write(path, text)
        self.assertEqual(packages.check(self.root), [finding])

    def test_version_of_another_release(self):
        self.expect("CMakeLists.txt", "project(krutil_protobuf VERSION 0.2.0 LANGUAGES CXX)\n",
                    "debian/changelog: expected version 0.2.0, as CMakeLists.txt has it, got 0.1.0")

    def test_package_of_another_soname(self):
        path = packages.LIBRARIES["libkrutil-platform"]
        self.expect(path, "SOVERSION 1)\n",
                    f"debian/control: expected a package libkrutil-platform1, after the SOVERSION in {path}")

    def test_build_package_that_is_not_asked_for(self):
        self.expect("scripts/packages.sh", self.BUILD.replace("g++", "g++ libssl-dev"),
                    "debian/control: Build-Depends lacks libssl-dev, which scripts/packages.sh lists for a build")

    def test_build_package_that_is_no_longer_needed(self):
        self.expect("scripts/packages.sh", self.BUILD.replace("libicu-dev", ""),
                    "debian/control: Build-Depends has libicu-dev, which scripts/packages.sh does not list for a build")

    def test_control_file_that_is_none(self):
        self.expect("debian/control", self.CONTROL + "more\n",
                    "debian/control: neither a field nor the rest of one: 'more'")


if __name__ == "__main__":
    unittest.main()
