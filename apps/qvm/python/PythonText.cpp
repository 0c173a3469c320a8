#include "qvm/python/PythonText.hpp"

#include <algorithm>

#include "msg_svc/protobuf/ustring.hpp"

namespace qvm {
namespace {

constexpr char16_t replacement = 0xFFFD;

}  // namespace

void appendUtf16(PyObject* text, std::size_t begin, std::size_t count, std::u16string& units) {
    const auto length = static_cast<std::size_t>(PyUnicode_GET_LENGTH(text));
    begin = std::min(begin, length);
    const std::size_t end = begin + std::min(count, length - begin);
    const int kind = PyUnicode_KIND(text);
    const void* data = PyUnicode_DATA(text);
    if (kind == PyUnicode_1BYTE_KIND) {
        const auto* const points = static_cast<const Py_UCS1*>(data);
        units.append(points + begin, points + end);
        return;
    }
    units.reserve(units.size() + (end - begin));
    for (std::size_t i = begin; i < end; ++i) {
        const Py_UCS4 point = PyUnicode_READ(kind, data, i);
        if (point >= 0x10000) {
            units += static_cast<char16_t>(0xD800 + ((point - 0x10000) >> 10));
            units += static_cast<char16_t>(0xDC00 + ((point - 0x10000) & 0x3FF));
        } else if (point >= 0xD800 && point <= 0xDFFF) {
            units += replacement;
        } else {
            units += static_cast<char16_t>(point);
        }
    }
}

std::u16string utf16Of(PyObject* text) {
    std::u16string units;
    appendUtf16(text, 0, static_cast<std::size_t>(PyUnicode_GET_LENGTH(text)), units);
    return units;
}

PyObject* strOf(const std::u16string& text) {
    const std::string utf8 = msg_svc::protobuf::ustring_to_utf8(text);
    return PyUnicode_DecodeUTF8(utf8.data(), static_cast<Py_ssize_t>(utf8.size()), "replace");
}

std::u16string promptedLines(const std::u16string& code) {
    std::u16string text;
    std::size_t begin = 0;
    do {
        const std::size_t end = std::min(code.find(u'\n', begin), code.size());
        text += begin == 0 ? u">>> " : u"... ";
        text.append(code, begin, end - begin);
        text += u'\n';
        begin = end + 1;
    } while (begin < code.size());
    return text;
}

}  // namespace qvm
