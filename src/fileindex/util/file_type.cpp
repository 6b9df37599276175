#include "fileindex/util/file_type.h"

#include <array>
#include <bit>
#include <cstddef>
#include <cstring>

#include "fileindex/util/file_type_table.h"

namespace vexlo::fileindex {
namespace {

// An extension of up to 15 bytes in lower case, the first byte lowest, with its length in the
// highest byte: a comparison is one of numbers.
__extension__ using Key = unsigned __int128;
constexpr size_t kKeyBytes = sizeof(Key);
constexpr size_t kMaxExtension = kKeyBytes - 1;

constexpr uint64_t Repeat(uint8_t byte) { return 0x0101010101010101ULL * byte; }

// 0x80 in each byte of `word` that is `byte`, 0 in the others.
constexpr uint64_t Find(uint64_t word, uint8_t byte) {
  const uint64_t differs = word ^ Repeat(byte);
  return ~(((differs & Repeat(0x7f)) + Repeat(0x7f)) | differs | Repeat(0x7f));
}

// Each byte from 'A' to 'Z' in lower case.
constexpr uint64_t Lower(uint64_t word) {
  const uint64_t low = word & Repeat(0x7f);
  const uint64_t from_a = low + Repeat(0x80 - 'A');
  const uint64_t above_z = low + Repeat(0x7f - 'Z');
  return word | (((from_a & ~above_z & ~word) & Repeat(0x80)) >> 2);
}

constexpr Key Join(uint64_t high, uint64_t low) { return (Key{high} << 64) | low; }
constexpr uint64_t High(Key key) { return static_cast<uint64_t>(key >> 64); }
constexpr uint64_t Low(Key key) { return static_cast<uint64_t>(key); }

constexpr Key MakeKey(Key bytes, size_t length) {
  return Join(Lower(High(bytes)) | (uint64_t{length} << 56), Lower(Low(bytes)));
}

constexpr Key MakeKey(std::string_view extension) {
  Key bytes = 0;
  for (size_t i = 0; i < extension.size(); ++i) {
    bytes |= Key{static_cast<unsigned char>(extension[i])} << (8 * i);
  }
  return MakeKey(bytes, extension.size());
}

// A hash table with open addressing that the compiler fills. Sparse, so that most look-ups end at
// the first slot.
constexpr size_t kSlotBits = 11;
constexpr size_t kSlots = size_t{1} << kSlotBits;
constexpr int8_t kEmpty = -1;

struct Table {
  std::array<Key, kSlots> keys{};
  std::array<int8_t, kSlots> types{};
  size_t count = 0;
};

constexpr size_t SlotOf(Key key) {
  const uint64_t mixed = (Low(key) ^ (High(key) * 0xff51afd7ed558ccdULL)) * 0x9e3779b97f4a7c15ULL;
  return static_cast<size_t>(mixed >> (64 - kSlotBits));
}

constexpr void Fill(Table& table, std::span<const std::string_view> extensions, FileType type) {
  for (const std::string_view extension : extensions) {
    const Key key = MakeKey(extension);
    size_t slot = SlotOf(key);
    while (table.types[slot] != kEmpty && table.keys[slot] != key) {
      slot = (slot + 1) % kSlots;
    }
    table.count += table.types[slot] == kEmpty ? 1 : 0;
    table.keys[slot] = key;
    table.types[slot] = static_cast<int8_t>(type);
  }
}

constexpr std::span<const std::string_view> ExtensionsOfType(FileType type) {
  switch (type) {
    case FILE_TYPE_DOCUMENT:
      return file_type_table::kDocument;
    case FILE_TYPE_AUDIO:
      return file_type_table::kAudio;
    case FILE_TYPE_VIDEO:
      return file_type_table::kVideo;
    case FILE_TYPE_PHOTO:
      return file_type_table::kPhoto;
    default:
      return {};
  }
}

constexpr Table MakeTable() {
  Table table;
  table.types.fill(kEmpty);
  for (const FileType type :
       {FILE_TYPE_DOCUMENT, FILE_TYPE_AUDIO, FILE_TYPE_VIDEO, FILE_TYPE_PHOTO}) {
    Fill(table, ExtensionsOfType(type), type);
  }
  return table;
}

constexpr Table kTable = MakeTable();
static_assert(kTable.count == 738, "an extension stands twice");

// Looked up when the end of the path does not say it.
std::string_view ExtensionOf(std::string_view path) {
  for (size_t i = path.size(); i > 0 && path[i - 1] != '/'; --i) {
    if (path[i - 1] == '.') {
      return path.substr(i);
    }
  }
  return "";
}

// The key of the path's extension; false when that is too long for the table.
bool FindKey(const std::string& path, Key& key) {
  if (std::endian::native == std::endian::little && path.size() >= kKeyBytes) {
    // The last 16 bytes at once, the last one highest, without a branch for each.
    uint64_t words[2];
    memcpy(words, path.data() + path.size() - kKeyBytes, kKeyBytes);
    const uint64_t stops[2] = {Find(words[0], '.') | Find(words[0], '/'),
                               Find(words[1], '.') | Find(words[1], '/')};
    if ((stops[0] | stops[1]) != 0) {
      const int bits = stops[1] != 0 ? std::countl_zero(stops[1]) : 64 + std::countl_zero(stops[0]);
      const size_t length = static_cast<size_t>(bits) / 8;
      const bool is_dot = path[path.size() - 1 - length] == '.';
      const Key bytes = Join(words[1], words[0]);
      key = is_dot && length > 0 ? MakeKey(bytes >> (8 * (kKeyBytes - length)), length)
                                 : MakeKey(Key{0}, 0);
      return true;
    }
  }
  const std::string_view extension = ExtensionOf(path);
  key = MakeKey(extension.substr(0, kMaxExtension));
  return extension.size() <= kMaxExtension;
}

}  // namespace

FileType GetFileTypeByFullPath(const std::string& full_path) {
  Key key = 0;
  if (!FindKey(full_path, key)) {
    return FILE_TYPE_OTHER;
  }
  for (size_t slot = SlotOf(key); kTable.types[slot] != kEmpty; slot = (slot + 1) % kSlots) {
    if (kTable.keys[slot] == key) {
      return static_cast<FileType>(kTable.types[slot]);
    }
  }
  return FILE_TYPE_OTHER;
}

std::span<const std::string_view> GetFileTypeExtensions(FileType type) {
  return ExtensionsOfType(type);
}

std::string_view GetFileTypeName(FileType type) {
  switch (type) {
    case FILE_TYPE_DOCUMENT:
      return "document";
    case FILE_TYPE_AUDIO:
      return "audio";
    case FILE_TYPE_VIDEO:
      return "video";
    case FILE_TYPE_PHOTO:
      return "photo";
    default:
      return "other";
  }
}

}  // namespace vexlo::fileindex
