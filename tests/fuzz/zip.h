// ZIP archives for the readers of documents.
#ifndef FUZZ_ZIP_H_
#define FUZZ_ZIP_H_

#include <archive.h>
#include <archive_entry.h>

#include <memory>
#include <string>
#include <utility>
#include <vector>

namespace fuzz {

// Names and contents.
using Parts = std::vector<std::pair<std::string, std::string>>;

// An archive of the parts in their order, less those whose name it does not take. The first is not
// compressed, as formats want it that tell their type there; nor are the others with `is_plain`.
inline std::string Zip(const Parts& parts, bool is_plain = false) {
  std::string bytes;
  const std::unique_ptr<struct archive, int (*)(struct archive*)> archive(archive_write_new(),
                                                                          archive_write_free);
  archive_write_set_format_zip(archive.get());
  archive_write_set_format_option(archive.get(), "zip", "compression-level", "1");
  archive_write_set_bytes_in_last_block(archive.get(), 1);
  archive_write_open(
      archive.get(), &bytes, nullptr,
      [](struct archive*, void* to, const void* data, size_t size) {
        static_cast<std::string*>(to)->append(static_cast<const char*>(data), size);
        return static_cast<la_ssize_t>(size);
      },
      nullptr);
  archive_write_zip_set_compression_store(archive.get());
  for (const auto& [name, content] : parts) {
    const std::unique_ptr<struct archive_entry, void (*)(struct archive_entry*)> entry(
        archive_entry_new(), archive_entry_free);
    archive_entry_set_pathname(entry.get(), name.c_str());
    archive_entry_set_size(entry.get(), static_cast<la_int64_t>(content.size()));
    archive_entry_set_filetype(entry.get(), AE_IFREG);
    if (archive_write_header(archive.get(), entry.get()) == ARCHIVE_OK) {
      archive_write_data(archive.get(), content.data(), content.size());
    }
    if (!is_plain) {
      archive_write_zip_set_compression_deflate(archive.get());
    }
  }
  archive_write_close(archive.get());
  return bytes;
}

}  // namespace fuzz

#endif  // FUZZ_ZIP_H_
