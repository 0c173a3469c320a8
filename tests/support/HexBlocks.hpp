// Bytes that a document shows.
#pragma once

#include <fstream>
#include <sstream>
#include <stdexcept>
#include <string>
#include <vector>

namespace test_support {

/// The bytes of each block of the document that is marked "hex": what stands before a semicolon on its lines. Throws
/// std::runtime_error when there is no such file.
inline std::vector<std::string> hexBlocksOf(const std::string& path) {
    std::ifstream file(path);
    if (!file) {
        throw std::runtime_error("Cannot read " + path);
    }
    std::vector<std::string> blocks;
    bool inside = false;
    for (std::string line; std::getline(file, line);) {
        if (line.starts_with("```")) {
            inside = line == "```hex";
            if (inside) {
                blocks.emplace_back();
            }
        } else if (inside) {
            std::istringstream digits(line.substr(0, line.find(';')));
            for (std::string pair; digits >> pair;) {
                blocks.back() += static_cast<char>(std::stoi(pair, nullptr, 16));
            }
        }
    }
    return blocks;
}

}  // namespace test_support
