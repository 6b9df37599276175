// The reader of office documents and e-books. An input that begins as a ZIP archive is read as it
// is; any other is packed into one first, or its checksums would keep every change from the parts:
// "NAME\n" and the content of each, ended by a NUL.
#include <archive.h>
#include <archive_entry.h>

#include <algorithm>
#include <memory>
#include <vector>

#include "daemons/kavocontentextractd/formats.h"
#include "fuzz/format.h"
#include "fuzz/target.h"

namespace {

// The archive without compression.
std::string Packed(std::string_view parts) {
  std::vector<char> space(parts.size() * 4 + 65536);
  size_t used = 0;
  const std::unique_ptr<struct archive, int (*)(struct archive*)> archive(archive_write_new(),
                                                                          archive_write_free);
  archive_write_set_format_zip(archive.get());
  archive_write_zip_set_compression_store(archive.get());
  fuzz::Require(
      archive_write_open_memory(archive.get(), space.data(), space.size(), &used) == ARCHIVE_OK,
      "no archive can be written");
  for (int entries = 0; !parts.empty() && entries < 50; ++entries) {
    std::string_view content = parts.substr(0, parts.find('\0'));
    parts.remove_prefix(std::min(content.size() + 1, parts.size()));
    const std::string name(fuzz::TakeLine(content).substr(0, 200));
    const std::unique_ptr<struct archive_entry, void (*)(struct archive_entry*)> entry(
        archive_entry_new(), archive_entry_free);
    archive_entry_set_pathname(entry.get(), name.c_str());
    archive_entry_set_size(entry.get(), static_cast<la_int64_t>(content.size()));
    archive_entry_set_filetype(entry.get(), AE_IFREG);
    if (archive_write_header(archive.get(), entry.get()) == ARCHIVE_OK) {
      archive_write_data(archive.get(), content.data(), content.size());
    }
  }
  archive_write_close(archive.get());
  return {space.data(), used};
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view input = fuzz::TextOf(data, size);
  fuzz::CheckReader(vexlo::extractd::ReadOffice, "application/zip",
                    input.starts_with("PK") ? std::string(input) : Packed(input));
  return 0;
}
