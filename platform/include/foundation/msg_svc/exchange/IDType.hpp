// Identifiers of requests, workspaces and exchanges.
#pragma once

#include <compare>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <iosfwd>
#include <string>

namespace foundation::msg_svc::exchange {

/// A 128-bit value. The default one (both halves 0) means "no identifier".
class IDType {
  public:
    constexpr IDType() noexcept = default;
    /// `hi` is the more significant half.
    constexpr IDType(std::uint64_t hi, std::uint64_t lo) noexcept : hi_(hi), lo_(lo) {}

    /// A fresh identifier: 128 bits from the operating system's random source, never the default one. Throws
    /// std::system_error when the source fails.
    static IDType random();

    /// The more significant half.
    constexpr std::uint64_t hi() const noexcept { return hi_; }
    /// The less significant half.
    constexpr std::uint64_t lo() const noexcept { return lo_; }

    constexpr auto operator<=>(const IDType&) const noexcept = default;  ///< by value, as one number of 128 bits

  private:
    std::uint64_t hi_ = 0;
    std::uint64_t lo_ = 0;
};

/// 32 lower-case hexadecimal digits, the high half first.
std::string toString(const IDType& id);

/// Writes toString(id).
std::ostream& operator<<(std::ostream& out, const IDType& id);

}  // namespace foundation::msg_svc::exchange

/// Lets identifiers be keys of unordered containers.
template <>
struct std::hash<foundation::msg_svc::exchange::IDType> {
    /// The same for equal identifiers, in this process and in others.
    std::size_t operator()(const foundation::msg_svc::exchange::IDType& id) const noexcept {
        return static_cast<std::size_t>(id.hi() * 0x9E3779B97F4A7C15ULL ^ id.lo());
    }
};
