"""Compiles qvm.py into a C++ source file, so that an engine starts without compiling it.

    CompilePythonModule.py SOURCE FILENAME OUTPUT

FILENAME is what the module's code says that it comes from. OUTPUT defines what QvmModuleCode.hpp declares.
"""
import marshal
import sys

source, filename, output = sys.argv[1:]
with open(source, encoding="utf-8") as file:
    code = marshal.dumps(compile(file.read(), filename, "exec", dont_inherit=True, optimize=0))
lines = [", ".join(map(str, code[begin:begin + 24])) for begin in range(0, len(code), 24)]
with open(output, "w", encoding="utf-8") as file:
    file.write('#include "qvm/python/QvmModuleCode.hpp"\n\nnamespace qvm {\nnamespace {\n\n'
               + "constexpr unsigned char code[] = {\n    " + ",\n    ".join(lines) + "};\n\n}  // namespace\n\n"
               + "std::string_view moduleCode() noexcept {\n"
               + "    return {reinterpret_cast<const char*>(code), sizeof(code)};\n}\n\n}  // namespace qvm\n")
