"""What the installed libraries export."""

import os
import re
import unittest

from tree import LINK_FLAGS, PREFIX, find, main, run


def exported(library):
    """Symbols that a shared library defines for others: (kind of nm, demangled name)."""
    lines = run("nm", "--dynamic", "--defined-only", "--demangle", library).splitlines()
    return [(kind, name) for _, kind, name in (line.split(" ", 2) for line in lines)]


class Symbols(unittest.TestCase):
    @unittest.skipIf(LINK_FLAGS, "sanitizers add symbols of their own")
    def test_only_the_protocol_and_the_generated_classes_are_exported(self):
        symbols = exported(find("libkrutil_protobuf.so"))
        names = {name for _, name in symbols}
        self.assertIn("krutil::protobuf::KrutilProtocol::init()", names)
        self.assertIn("krutil::protobuf::EvalIIP::EvalIIP(google::protobuf::Arena*, bool)", names)
        self.assertIn("krutil::protobuf::StreamType_IsValid(int)", names)
        protos = os.path.join(PREFIX, "share/krutil_protobuf/proto")
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


if __name__ == "__main__":
    main("nm")
