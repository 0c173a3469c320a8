// What a test does as somebody else.
#pragma once

#include <gtest/gtest.h>
#include <unistd.h>

namespace test_support {

/// While an object lives, this process has the rights of `nobody`, whom the kernel tells to whoever asks for its user.
class AnotherUser {
  public:
    static constexpr uid_t number = 65534;

    /// Only the administrator can become somebody else.
    static bool isPossible() { return ::geteuid() == 0; }

    AnotherUser() {
        EXPECT_EQ(::setegid(number), 0);
        EXPECT_EQ(::seteuid(number), 0);
    }
    ~AnotherUser() {
        EXPECT_EQ(::seteuid(0), 0);
        EXPECT_EQ(::setegid(0), 0);
    }
    AnotherUser(const AnotherUser&) = delete;
    AnotherUser& operator=(const AnotherUser&) = delete;
};

}  // namespace test_support
