// Linked into every test program: what the person who runs it has set for other sessions does not reach it, nor the
// programs that it starts.

#include <cstdlib>

namespace {

// Before everything else, because the first array serializer reads the variable, and samples are made before main().
[[gnu::constructor(101)]] void clearEnvironment() {
    ::unsetenv("QX_DISABLE_ZEROCOPY");
}

}  // namespace
