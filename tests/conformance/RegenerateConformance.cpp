// Rewrites manifest and bytes of the conformance vectors from the samples, removes files of no vector, and says what it
// did. Look at the difference before you commit it: every changed byte is one that peers see.

#include <exception>
#include <fstream>
#include <iostream>

#include "conformance/vectors/Manifest.hpp"

int main() try {
    const auto wanted = conformance::renderedFiles();
    for (const auto& [path, content] : conformance::filesOnDisk()) {
        if (!wanted.contains(path)) {
            std::filesystem::remove(conformance::directory() / path);
            std::cout << "removed " << path.string() << '\n';
        }
    }
    for (const auto& [path, content] : wanted) {
        const auto file = conformance::directory() / path;
        std::filesystem::create_directories(file.parent_path());
        std::ofstream out(file, std::ios::binary);
        out << content;
        out.close();
        if (!out) {
            std::cerr << "krutil_regenerate_conformance: cannot write " << file << '\n';
            return 1;
        }
    }
    std::cout << "wrote " << wanted.size() << " files to " << conformance::directory().string() << '\n';
    return 0;
} catch (const std::exception& error) {
    std::cerr << "krutil_regenerate_conformance: " << error.what() << '\n';
    return 1;
}
