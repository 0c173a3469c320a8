// One argument of a format text.
#pragma once

#include <boost/variant.hpp>
#include <string>
#include <utility>

namespace korvel::lang {

/// A value of one of the types that a format text can take. A value type; the default one is the int 0.
class PrintfArgument {
  public:
    /// The types that a format text can take.
    using Value = boost::variant<int, unsigned int, long, unsigned long, double, std::u16string>;

    PrintfArgument() = default;
    /// Holds `value`, and its type.
    explicit PrintfArgument(Value value) : value_(std::move(value)) {}

    /// The value, in its type.
    const Value& getValue() const noexcept { return value_; }

    /// The same type and the same value; a NaN equals nothing.
    bool operator==(const PrintfArgument& other) const { return value_ == other.value_; }

  private:
    Value value_;
};

}  // namespace korvel::lang
