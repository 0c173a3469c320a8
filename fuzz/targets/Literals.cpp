// Any text as an argument of a function call: it is an array, or refused at a place within it.

#include <cstdint>
#include <string>

#include "input/Require.hpp"
#include "krutil/arrays/ArgumentLiteral.hpp"
#include "krutil/arrays/ArrayText.hpp"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const std::string text(data, data + size);
    try {
        krutil_client::arrayText(krutil_client::parseLiteral(text));
    } catch (const krutil_client::LiteralError& error) {
        fuzz::require(error.offset() <= size, "an error has its place within the text");
    }
    return 0;
}
