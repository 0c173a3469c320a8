// Rewrites the golden files from the samples, removes those of no serializer, and says what it did. Look at the
// difference before you commit it: every changed byte is one that peers see.

#include <exception>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <set>

#include "krutil_protobuf/support/Goldens.hpp"

int main() try {
    const auto registry = transport::sessionRegistry();
    std::set<std::filesystem::path> written;
    std::filesystem::create_directories(goldens::directory());
    for (const auto& serializer : registry->serializers()) {
        const auto file = goldens::fileOf(serializer->name());
        const std::string content = goldens::render(samples::sampleSet(serializer->name()), registry);
        std::ofstream out(file, std::ios::binary);
        out << content;
        out.close();
        if (!out) {
            std::cerr << "krutil_regenerate_goldens: cannot write " << file << '\n';
            return 1;
        }
        written.insert(file);
        std::cout << "wrote " << file.filename().string() << '\n';
    }
    for (const auto& entry : std::filesystem::directory_iterator(goldens::directory())) {
        if (!written.contains(entry.path())) {
            std::filesystem::remove(entry.path());
            std::cout << "removed " << entry.path().filename().string() << '\n';
        }
    }
    return 0;
} catch (const std::exception& error) {
    std::cerr << "krutil_regenerate_goldens: " << error.what() << '\n';
    return 1;
}
