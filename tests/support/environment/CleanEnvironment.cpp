// Linked into every test program: what the person who runs it has set for other sessions does not reach it, nor the
// programs that it starts.

#include <unistd.h>

#include <cstdlib>
#include <string>
#include <vector>

namespace {

// Before everything else, because the first array serializer reads its variable, and samples are made before main().
[[gnu::constructor(101)]] void clearEnvironment() {
    std::vector<std::string> names{"QX_DISABLE_ZEROCOPY", "VIRTUAL_ENV"};
    for (char** each = ::environ; *each != nullptr; ++each) {
        const std::string entry = *each;
        if (entry.starts_with("PYTHON")) {
            names.push_back(entry.substr(0, entry.find('=')));
        }
    }
    for (const std::string& name : names) {
        ::unsetenv(name.c_str());
    }
}

}  // namespace
