// What is cut to the bounds fits the peer's limit.
#include "qvm/requests/MessageBounds.hpp"

#include <gtest/gtest.h>

namespace qvm_test {
namespace {

using foundation::msg_svc::transport::layers::session::Limits;
using qvm::MessageBounds;

MessageBounds boundsFor(std::uint64_t taggedFrame) {
    Limits limits;
    limits.taggedFrame = taggedFrame;
    return MessageBounds(limits);
}

TEST(MessageBoundsTest, TextsFitAlsoWhenAllTheirCharactersAreTheLongest) {
    for (const std::uint64_t limit : {4'096U, 65'536U, 1U << 20, 4U << 20, 64U << 20}) {
        const MessageBounds bounds = boundsFor(limit);
        EXPECT_LT(bounds.textUnits * 3, limit);
        EXPECT_LT(bounds.warningUnits * 3, limit);
        // An error to print travels with its record.
        EXPECT_LT(bounds.errorBytes + bounds.printedCharacters * 4, limit);
    }
}

TEST(MessageBoundsTest, PiecesOfTextStayUsefulAndSmall) {
    EXPECT_EQ(boundsFor(1).textUnits, 16U);
    EXPECT_EQ(boundsFor(4U << 20).textUnits, 32'768U);
    EXPECT_EQ(boundsFor(4U << 20).errorBytes, 2U << 20);
    EXPECT_EQ(boundsFor(64U << 20).errorBytes, 2U << 20);
    EXPECT_EQ(boundsFor(64U << 20).warningUnits, 8U << 20);
}

}  // namespace
}  // namespace qvm_test
