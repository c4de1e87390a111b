// Whole-file helpers for tests.
#pragma once

#include <cstdint>
#include <filesystem>
#include <string>
#include <vector>

namespace testing_support {

using Bytes = std::vector<uint8_t>;

std::string readText(const std::filesystem::path& path);
Bytes readBytes(const std::filesystem::path& path);
void writeText(const std::filesystem::path& path, const std::string& text);
void writeBytes(const std::filesystem::path& path, const Bytes& bytes);

// The bytes of `text`, without a terminator.
Bytes bytesOf(const std::string& text);
// 0, 1, 2, ... modulo 256, `count` of them.
Bytes counting(size_t count);

// Bytes as lower-case hex, two digits each, and back; fromHex takes either
// case and throws std::invalid_argument for anything else.
std::string hex(const Bytes& bytes);
Bytes fromHex(const std::string& text);

}  // namespace testing_support
