#include <gtest/gtest.h>

#include "msg_svc/protobuf/ustring.hpp"
#include "qvm/process/OutputCapture.hpp"

namespace qvm_test {
namespace {

using qvm::Utf8Assembler;

// All of `bytes`, given in pieces of `size`.
std::u16string inPieces(const std::string& bytes, std::size_t size) {
    Utf8Assembler assembler;
    std::u16string text;
    for (std::size_t begin = 0; begin < bytes.size(); begin += size) {
        text += assembler.add(std::string_view(bytes).substr(begin, size));
    }
    return text + assembler.finish();
}

TEST(Utf8AssemblerTest, PiecesGiveTheTextOfTheWhole) {
    for (const char* bytes :
         {"plain", "\xC3\xA9\xE2\x82\xAC\xF0\x9F\x98\x80", "a\xFF\x62", "\xE2\x82", "\xE2\x82z", "\xF0\x9F\x98\xC3\xA9",
          "\x80\x80\x80\x80", "\xC0\xAF\xED\xA0\x80\xF5\x80", "\xF0\x9F\x98"}) {
        const std::u16string whole = msg_svc::protobuf::utf8_to_ustring(bytes);
        for (std::size_t size = 1; size <= 5; ++size) {
            EXPECT_EQ(inPieces(bytes, size), whole) << bytes << " in pieces of " << size;
        }
    }
}

TEST(Utf8AssemblerTest, OnlyTheBeginningOfASequenceIsHeldBack) {
    Utf8Assembler assembler;
    EXPECT_EQ(assembler.add("ab\xE2\x82"), u"ab");
    EXPECT_EQ(assembler.add("\xAC"), u"\u20ac");
    EXPECT_EQ(assembler.add("\xFF"), u"\uFFFD");
    EXPECT_EQ(assembler.finish(), u"");
}

}  // namespace
}  // namespace qvm_test
