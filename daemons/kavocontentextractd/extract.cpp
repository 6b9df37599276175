#include "daemons/kavocontentextractd/extract.h"

#include <magic.h>

#include <algorithm>
#include <clocale>
#include <exception>
#include <iterator>
#include <new>
#include <stdexcept>
#include <string_view>

#include "common/string.h"
#include "daemons/kavocontentextractd/document.h"
#include "daemons/kavocontentextractd/fault.h"
#include "daemons/kavocontentextractd/formats.h"
#include "daemons/kavocontentextractd/plain_text.h"
#include "daemons/kavocontentextractd/source.h"
#include "fileindex/elastic_control/schema.h"
#include "kavo/local/content.h"

namespace vexlo::extractd {
namespace {

namespace field = fileindex::elastic::field;
namespace reason = kavo::local::content_reason;

constexpr size_t kHeadBytes = size_t{64} << 10;

using Reader = void (*)(const Source& source, const std::string& type, Document& document);

struct Format {
  std::string_view type;  // A media type, or its beginning up to "/" or ".".
  Reader read;
};
constexpr Format kFormats[] = {
    {"application/epub+zip", ReadOffice},
    {"application/pdf", ReadPdf},
    {"application/rtf", ReadRtf},
    {"application/vnd.oasis.opendocument.", ReadOffice},
    {"application/vnd.openxmlformats-officedocument.", ReadOffice},
    {"application/xhtml+xml", ReadHtml},
    {"application/zip", ReadOffice},  // Documents of some programs look like any archive.
    {"audio/", ReadAudio},
    {"application/ogg", ReadAudio},
    {"image/svg+xml", ReadHtml},
    {"image/", ReadPhoto},
    {"text/html", ReadHtml},
    {"text/rtf", ReadRtf},
    {"video/", ReadMedia},
};
// What the beginning of a file does not tell.
constexpr Format kExtensions[] = {
    {"htm", ReadHtml}, {"html", ReadHtml},  {"mp3", ReadAudio},
    {"svg", ReadHtml}, {"xhtml", ReadHtml},
};

// UTF-8 that is no markup: the table of types takes milliseconds to come to the same.
bool IsClearlyText(std::string_view head, bool has_more) {
  constexpr std::string_view kMarkup[] = {"<", "{\\rtf", "%PDF", "%!"};
  const size_t start = head.find_first_not_of(" \t\r\n\xEF\xBB\xBF");
  const std::string_view text = head.substr(std::min(start, head.size()));
  return !HasBinaryControls(head) && IsUtf8(head, has_more) &&
         std::none_of(std::begin(kMarkup), std::end(kMarkup),
                      [text](std::string_view markup) { return text.starts_with(markup); });
}

// The type of what files mostly are, found in no time; null for others.
const char* QuickType(std::string_view head, bool has_more) {
  if (head.starts_with("%PDF-")) {
    return "application/pdf";
  }
  if (head.starts_with("\xFF\xD8\xFF")) {
    return "image/jpeg";
  }
  return IsClearlyText(head, has_more) ? "text/plain" : nullptr;
}

Reader FindReader(std::string_view type) {
  for (const Format& row : kFormats) {
    const bool is_beginning = row.type.ends_with('/') || row.type.ends_with('.');
    if (is_beginning ? type.starts_with(row.type) : type == row.type) {
      return row.read;
    }
  }
  return nullptr;
}

// Binary documents of older programs: what is in them is not read, but one kind of them holds a
// newer document under a password.
bool IsEncryptedOffice(std::string_view head) {
  constexpr std::string_view kCompoundFile = "\xD0\xCF\x11\xE0\xA1\xB1\x1A\xE1";
  constexpr char kName[] = "E\0n\0c\0r\0y\0p\0t\0e\0d\0P\0a\0c\0k\0a\0g\0e";
  return head.starts_with(kCompoundFile) &&
         head.find({kName, sizeof(kName) - 1}) != std::string_view::npos;
}

// The beginning of a text may look like that of a picture or a sound.
bool IsMedia(std::string_view type) {
  return type.starts_with("image/") || type.starts_with("audio/") || type.starts_with("video/");
}

void Read(const Source& source, std::string type, const std::string& head, Document& document) {
  Reader read = FindReader(type);
  if (read == nullptr && head.starts_with("PK\x03\x04")) {
    type = "application/zip";  // Of unusual archives the table says nothing.
    read = ReadOffice;
  }
  if (read == nullptr && (type.starts_with("text/") || type == "application/octet-stream")) {
    const std::string extension = GetFileExtension(source.Name(), /*lower=*/true);
    const Format* const row =
        std::find_if(std::begin(kExtensions), std::end(kExtensions),
                     [&](const Format& format) { return format.type == extension; });
    read = row == std::end(kExtensions) ? nullptr : row->read;
  }
  document.SetText(field::KAVOMDContentType, type);
  if (read != nullptr) {
    try {
      read(source, type, document);
    } catch (const Fault& fault) {
      if (fault.Reason() != reason::kDamaged || !IsMedia(type) ||
          !ReadPlainText(source, document)) {
        throw;
      }
      document.SetText(field::KAVOMDContentType, "text/plain");
    }
  } else if (IsEncryptedOffice(head)) {
    throw Fault(reason::kEncrypted, "the document wants a password");
  } else if (ReadPlainText(source, document)) {
    document.SetText(field::KAVOMDContentType, "text/plain");
  }
}

}  // namespace

Extractor::Extractor()
    : types_(magic_open(MAGIC_MIME_TYPE | MAGIC_NO_CHECK_COMPRESS | MAGIC_NO_CHECK_JSON |
                        MAGIC_NO_CHECK_CSV),
             magic_close) {
  if (types_ == nullptr || magic_load(types_.get(), nullptr) != 0) {
    throw std::runtime_error("the table of file types cannot be loaded");
  }
  // Names in archives come in the locale's encoding, and those that it has no letters for not at
  // all. Where this one is not installed, parts with such names count as damaged.
  (void)setlocale(LC_CTYPE, "C.UTF-8");  // NOLINT(concurrency-mt-unsafe): there is one thread.
}

Json::Value Extractor::Extract(int file, const std::string& name) const {
  Document document;
  Fault fault("", "");
  try {
    const Source source(file, name);
    const std::string head = source.Read(kHeadBytes);
    const char* type = QuickType(head, source.Size() > head.size());
    type = type == nullptr ? magic_buffer(types_.get(), head.data(), head.size()) : type;
    Read(source, type == nullptr ? "application/octet-stream" : type, head, document);
  } catch (const Fault& thrown) {
    fault = thrown;
  } catch (const std::bad_alloc&) {
    throw;
  } catch (const std::exception& thrown) {
    fault = Fault(reason::kDamaged, thrown.what());
  }
  if (fault.Reason().empty()) {
    return document.Take("");
  }
  return document.IsEmpty() ? ReplyOf(fault) : document.Take(fault.Reason() + ": " + fault.what());
}

}  // namespace vexlo::extractd
