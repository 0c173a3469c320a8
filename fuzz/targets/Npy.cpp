// Any file as .npy: it holds an array, every element of which can be used, or it is refused. An array is written as the
// same file again.

#include <cstdint>

#include "input/MemoryFile.hpp"
#include "krutil/arrays/ArrayText.hpp"
#include "krutil/arrays/NpyFile.hpp"
#include "krutil/base/ExitCode.hpp"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const fuzz::MemoryFile file(data, size);
    try {
        foundation::korveldata::Array array = krutil_client::readNpy(file.path());
        krutil_client::arrayText(array);
        array.mutableData();
    } catch (const krutil_client::Failure&) {
    }
    return 0;
}
