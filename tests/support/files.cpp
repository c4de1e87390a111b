#include "files.h"

#include <fstream>
#include <iterator>
#include <stdexcept>

namespace testing_support {

std::string readText(const std::filesystem::path& path) {
    std::ifstream in(path, std::ios::binary);
    if (!in) throw std::runtime_error("cannot read " + path.string());
    return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

Bytes readBytes(const std::filesystem::path& path) {
    const std::string text = readText(path);
    return Bytes(text.begin(), text.end());
}

void writeText(const std::filesystem::path& path, const std::string& text) {
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out.write(text.data(), static_cast<std::streamsize>(text.size()));
    if (!out) throw std::runtime_error("cannot write " + path.string());
}

void writeBytes(const std::filesystem::path& path, const Bytes& bytes) {
    writeText(path, std::string(bytes.begin(), bytes.end()));
}

}  // namespace testing_support
