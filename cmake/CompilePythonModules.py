"""Compiles Python modules into a C++ source file, so that an engine starts without compiling them.

    CompilePythonModules.py OUTPUT FILENAME SOURCE...

FILENAME is what the modules' code says that it comes from. OUTPUT defines what EngineModules.hpp declares.
"""
import marshal
import pathlib
import sys

output, filename, *sources = sys.argv[1:]
arrays, rows = [], []
for source in map(pathlib.Path, sources):
    code = marshal.dumps(compile(source.read_text(encoding="utf-8"), filename, "exec", dont_inherit=True, optimize=0))
    lines = [", ".join(map(str, code[begin:begin + 24])) for begin in range(0, len(code), 24)]
    arrays.append(f"constexpr unsigned char {source.stem}[] = {{\n    " + ",\n    ".join(lines) + "};\n\n")
    rows.append(f'    {{"{source.stem}", {source.stem}, sizeof({source.stem}), 0, nullptr}},\n')
with open(output, "w", encoding="utf-8") as file:
    file.write('#include "qvm/python/EngineModules.hpp"\n\nnamespace qvm {\nnamespace {\n\n'
               + "".join(arrays)
               + "constexpr _frozen modules[] = {\n" + "".join(rows)
               + "    {nullptr, nullptr, 0, 0, nullptr}};\n\n}  // namespace\n\n"
               + "const _frozen* engineModules() noexcept {\n    return modules;\n}\n\n}  // namespace qvm\n")
