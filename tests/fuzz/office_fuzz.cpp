// The reader of office documents and e-books. An input that begins as a ZIP archive is read as it
// is; any other is packed into one first, or its checksums would keep every change from the parts:
// "NAME\n" and the content of each, ended by a NUL.
#include <algorithm>

#include "daemons/kavocontentextractd/formats.h"
#include "fuzz/format.h"
#include "fuzz/target.h"
#include "fuzz/zip.h"

namespace {

std::string Packed(std::string_view rest) {
  constexpr size_t kMostParts = 50;
  fuzz::Parts parts;
  parts.reserve(kMostParts);
  while (!rest.empty() && parts.size() < kMostParts) {
    std::string_view content = rest.substr(0, rest.find('\0'));
    rest.remove_prefix(std::min(content.size() + 1, rest.size()));
    const std::string_view name = fuzz::TakeLine(content).substr(0, 200);
    parts.emplace_back(name, content);
  }
  return fuzz::Zip(parts, /*is_plain=*/true);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view input = fuzz::TextOf(data, size);
  fuzz::CheckReader(vexlo::extractd::ReadOffice, "application/zip",
                    input.starts_with("PK") ? std::string(input) : Packed(input));
  return 0;
}
