// Names nobody can predict: temporary entries and download directories are made under them, so
// that nobody can plant something at the name first.
#pragma once

#include <cstddef>
#include <string>

namespace tavrix::io {

// Fills size bytes at bytes from the kernel's random source. False when it gave fewer.
bool fillRandom(void* bytes, std::size_t size);

// 64 random bits as 16 hex digits. Should the kernel give none, the process, a count and the time
// still keep this process's names apart from each other and from those of an earlier run.
std::string uniqueHexSuffix();

}  // namespace tavrix::io
