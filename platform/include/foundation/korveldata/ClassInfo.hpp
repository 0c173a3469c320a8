// What is known about the class of an object array.
#pragma once

#include <string>
#include <vector>

namespace foundation::korveldata {

/// A plain value.
struct ClassInfo {
    std::string name;                        ///< qualified name of the class
    std::vector<std::string> propertyNames;  ///< in declaration order

    bool operator==(const ClassInfo&) const = default;  ///< the same in every part
};

}  // namespace foundation::korveldata
