// What the fuzz targets share.
#ifndef FUZZ_TARGET_H_
#define FUZZ_TARGET_H_

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

// Each target defines it: reads one input, returns 0, and ends the program when something is wrong.
extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

namespace fuzz {

inline std::string_view TextOf(const uint8_t* data, size_t size) {
  return {reinterpret_cast<const char*>(data), size};
}

// Ends the program with the text on standard error when `holds` is false.
void Require(bool holds, const char* what);
// The same, and shows both texts.
void RequireEqual(const std::string& got, const std::string& want, const char* what);

// A folder of the process's own, in memory where the system has such a place, made at the first
// call and removed when the program ends by itself. FILEINDEX_ROOT in the environment names it,
// too.
const std::string& Folder();

void WriteFile(const std::string& path, std::string_view content);

bool IsUtf8(std::string_view text);

// The lines without their newlines, as std::getline finds them.
std::string_view TakeLine(std::string_view& rest);

}  // namespace fuzz

#endif  // FUZZ_TARGET_H_
