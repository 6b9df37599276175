// Office documents and e-books: ZIP archives of XML and XHTML, by libarchive and expat.
#include <archive.h>
#include <archive_entry.h>
#include <unistd.h>

#include <algorithm>
#include <functional>
#include <iterator>
#include <memory>
#include <optional>
#include <utility>

#include "common/string.h"
#include "daemons/kavocontentextractd/fault.h"
#include "daemons/kavocontentextractd/formats.h"
#include "daemons/kavocontentextractd/xml.h"
#include "fileindex/elastic_control/schema.h"
#include "kavo/local/content.h"

namespace vexlo::extractd {
namespace {

namespace field = fileindex::elastic::field;
namespace reason = kavo::local::content_reason;

// What a document may unpack to: of the largest that people write it is a multiple, of a bomb a
// small part.
constexpr uint64_t kMostUnpacked = uint64_t{128} << 20;
constexpr size_t kMostEntries = 20000;
constexpr size_t kBlockBytes = size_t{64} << 10;
constexpr size_t kMostPageBytes = size_t{16} << 20;

constexpr std::string_view kOpenDocument = "application/vnd.oasis.opendocument.";
constexpr std::string_view kEpub = "application/epub+zip";

// The header or footer of a sheet without its codes: "&CPlan &P" is "Plan ", "&&" is "&".
std::string WithoutCodes(std::string_view text) {
  std::string plain;
  for (size_t i = 0; i < text.size(); ++i) {
    if (text[i] != '&') {
      plain += text[i];
    } else if (const char code = ++i < text.size() ? text[i] : '\0'; code == '&') {
      plain += '&';
    } else if (code == '"') {  // A font.
      i = std::min(text.find('"', i + 1), text.size());
    } else if (code == 'K') {  // A colour.
      constexpr size_t kDigits = 6;
      i += kDigits;
    } else if (code >= '0' && code <= '9') {  // A size.
      i = std::min(text.find_first_not_of("0123456789", i), text.size()) - 1;
    } else {
      plain += ' ';  // A place, a style, or what is put in.
    }
  }
  return plain;
}

// The text of office documents. OOXML has it in elements "t" ("w:t", "a:t", "t" of sheets), the
// cells' numbers in "v"; OpenDocument has it everywhere below "body". Notes, comments and text
// boxes stand within the paragraph, and often behind a word without white space.
class TextHandler : public XmlHandler {
 public:
  // The numbers go to `numbers`.
  TextHandler(bool is_open_document, Text& text, Text& numbers)
      : is_open_document_(is_open_document), text_(text), numbers_(numbers) {}

  void Start(std::string_view name, const Attributes& attributes) override {
    if (is_open_document_) {
      StartOpenDocument(name);
    } else if (name == "p" || name == "br" || name == "cr") {
      text_.EndLine();
    } else if (name == "t" || name == "text") {  // "text" is that of a slide's comment.
      taker_ = &text_;
    } else if (IsSheetHeader(name)) {
      is_header_ = true;
    } else if (name == "c") {
      const std::string_view type = attributes.Get("t");
      const bool is_number = type.empty() || type == "n";
      cell_ = is_number ? &numbers_ : type == "str" ? &text_ : nullptr;
    } else if (name == "v") {
      taker_ = cell_;
    } else if (name == "tab") {
      text_.Append("\t");
    } else if (name == "noBreakHyphen") {
      text_.Append("-");
    }
  }

  void End(std::string_view name) override {
    if (is_open_document_) {
      if (name == "p" || name == "h") {
        text_.EndLine();
      } else if (StandsApart(name)) {
        text_.EndWord();
      } else if (name == "body") {
        taker_ = nullptr;
      }
      return;
    }
    if (name == "t" || name == "v" || name == "text") {
      taker_ = nullptr;
    }
    // Paragraphs, strings of sheets, rows, comments; cells end as words do.
    if (name == "p" || name == "si" || name == "row" || name == "is" || name == "text") {
      text_.EndLine();
      if (name == "row") {
        numbers_.EndLine();
      }
    } else if (IsSheetHeader(name)) {
      text_.Append(WithoutCodes(header_));
      text_.EndLine();
      header_.clear();
      is_header_ = false;
    } else if (name == "v" && cell_ != nullptr) {
      cell_->EndWord();
    }
  }

  void Characters(std::string_view text) override {
    if (taker_ != nullptr) {
      taker_->Append(text);
    } else if (is_header_) {
      constexpr size_t kMost = 4096;  // Sixteen times what programs allow.
      header_ += text.substr(0, kMost - std::min(kMost, header_.size()));
    }
  }

 private:
  // Whether the element is a text of its own in the midst of a paragraph: a note's number, a
  // comment's author and date, what a picture shows.
  static bool StandsApart(std::string_view name) {
    constexpr std::string_view kNames[] = {"note-citation", "creator", "date", "title", "desc"};
    return std::find(std::begin(kNames), std::end(kNames), name) != std::end(kNames);
  }

  // "oddHeader", "firstFooter" and the like.
  static bool IsSheetHeader(std::string_view name) {
    return (name.ends_with("Header") || name.ends_with("Footer")) && name != "headerFooter";
  }

  void StartOpenDocument(std::string_view name) {
    if (name == "body") {
      taker_ = &text_;
    } else if (name == "p" || name == "h" || name == "line-break") {
      text_.EndLine();
    } else if (StandsApart(name)) {
      text_.EndWord();
    } else if (name == "s") {
      text_.Append(" ");
    } else if (name == "tab") {
      text_.Append("\t");
    }
  }

  const bool is_open_document_;
  Text& text_;
  Text& numbers_;
  Text* taker_ = nullptr;  // Of the characters to come.
  Text* cell_ = nullptr;   // Of the value of the cell.
  bool is_header_ = false;
  std::string header_;
};

enum class Kind { kText, kList, kNumber, kDate };

struct Property {
  std::string_view name;  // Of an element, or of an attribute of "document-statistic".
  const char* field;
  Kind kind;
};
// Of all formats: Dublin Core, the properties of OOXML, those of OpenDocument.
constexpr Property kProperties[] = {
    {"title", field::KAVOMDTitle, Kind::kText},
    {"creator", field::KAVOMDAuthors, Kind::kList},
    {"initial-creator", field::KAVOMDAuthors, Kind::kList},
    {"contributor", field::KAVOMDContributors, Kind::kList},
    {"subject", field::KAVOMDSubject, Kind::kText},
    {"description", field::KAVOMDDescription, Kind::kText},
    {"keywords", field::KAVOMDKeywords, Kind::kList},
    {"keyword", field::KAVOMDKeywords, Kind::kList},
    {"category", field::KAVOMDCategory, Kind::kText},
    {"language", field::KAVOMDLanguages, Kind::kList},
    {"publisher", field::KAVOMDPublishers, Kind::kList},
    {"identifier", field::KAVOMDIdentifier, Kind::kText},
    {"rights", field::KAVOMDRights, Kind::kText},
    {"created", field::KAVOMDContentCreationDate, Kind::kDate},
    {"creation-date", field::KAVOMDContentCreationDate, Kind::kDate},
    {"generator", field::KAVOMDEncodingApplications, Kind::kText},
    {"Application", field::KAVOMDEncodingApplications, Kind::kText},
    {"Company", field::KAVOMDOrganizations, Kind::kText},
    {"Manager", field::KAVOMDManager, Kind::kText},
    {"Template", field::KAVOMDTemplate, Kind::kText},
    {"Pages", field::KAVOMDPageCount, Kind::kNumber},
    {"Slides", field::KAVOMDPageCount, Kind::kNumber},
    {"page-count", field::KAVOMDPageCount, Kind::kNumber},
    {"Words", field::KAVOMDWordCount, Kind::kNumber},
    {"word-count", field::KAVOMDWordCount, Kind::kNumber},
};

void SetProperty(std::string_view name, const std::string& value, Document& document) {
  const Property* const property =
      std::find_if(std::begin(kProperties), std::end(kProperties),
                   [name](const Property& row) { return row.name == name; });
  if (property == std::end(kProperties)) {
    return;
  }
  switch (property->kind) {
    case Kind::kText:
      document.SetFirstText(property->field, value);
      break;
    case Kind::kList:
      document.AddText(property->field, value);
      break;
    case Kind::kNumber:
      document.SetNumber(property->field, strtoll(value.c_str(), nullptr, 10));
      break;
    case Kind::kDate:
      document.SetDate(property->field, value);
      break;
  }
}

class PropertyHandler : public XmlHandler {
 public:
  explicit PropertyHandler(Document& document) : document_(document) {}

  void Start(std::string_view name, const Attributes& attributes) override {
    value_.clear();
    if (name == "document-statistic") {
      for (const char* const count : {"page-count", "word-count"}) {
        SetProperty(count, std::string(attributes.Get(count)), document_);
      }
    }
  }
  void End(std::string_view name) override {
    SetProperty(name, value_, document_);
    value_.clear();
  }
  void Characters(std::string_view text) override {
    constexpr size_t kMost = size_t{64} << 10;
    value_ += text.substr(0, kMost - std::min(kMost, value_.size()));
  }

 private:
  Document& document_;
  std::string value_;
};

// Finds the entry of an encrypted part in META-INF/manifest.xml.
class ManifestHandler : public XmlHandler {
 public:
  void Start(std::string_view name, const Attributes& /*attributes*/) override {
    if (name == "encryption-data") {
      throw Fault(reason::kEncrypted, "the document wants a password");
    }
  }
  void End(std::string_view /*name*/) override {}
  void Characters(std::string_view /*text*/) override {}
};

bool IsPage(std::string_view name) {
  return name.ends_with(".xhtml") || name.ends_with(".html") || name.ends_with(".htm");
}

// Looks for pages in META-INF/encryption.xml of an e-book; mostly it names fonts alone, which hide
// nothing.
class BookEncryptionHandler : public XmlHandler {
 public:
  void Start(std::string_view name, const Attributes& attributes) override {
    has_pages_ = has_pages_ ||
                 (name == "CipherReference" && IsPage(ToLower(std::string(attributes.Get("URI")))));
  }
  void End(std::string_view /*name*/) override {}
  void Characters(std::string_view /*text*/) override {}

  bool HasPages() const { return has_pages_; }

 private:
  bool has_pages_ = false;
};

class Archive {
 public:
  explicit Archive(const Source& source) : archive_(archive_read_new(), archive_read_free) {
    if (archive_ == nullptr) {
      throw std::bad_alloc();
    }
    archive_read_support_format_zip(archive_.get());
    if (lseek(source.Fd(), 0, SEEK_SET) != 0 ||
        archive_read_open_fd(archive_.get(), source.Fd(), kBlockBytes) != ARCHIVE_OK) {
      Fail();
    }
  }

  // The name of the next entry, "" for one that cannot be read; nothing at the end.
  std::optional<std::string> Next() {
    struct archive_entry* entry = nullptr;
    const int result = archive_read_next_header(archive_.get(), &entry);
    if (result == ARCHIVE_EOF) {
      return std::nullopt;
    }
    if (result < ARCHIVE_WARN) {
      Fail();
    }
    if (++entries_ > kMostEntries) {
      throw Fault(reason::kOversized, "over " + std::to_string(kMostEntries) + " entries");
    }
    is_encrypted_ = archive_entry_is_data_encrypted(entry) == 1;
    const char* const name = archive_entry_pathname(entry);
    return name == nullptr ? "" : name;
  }

  // Gives the entry in parts to `take`, which returns false when it wants no more.
  void Read(const std::function<bool(std::string_view part, bool is_last)>& take) {
    if (is_encrypted_) {
      throw Fault(reason::kEncrypted, "the archive wants a password");
    }
    char buffer[kBlockBytes];
    while (true) {
      const la_ssize_t count = archive_read_data(archive_.get(), buffer, sizeof(buffer));
      if (count < 0) {
        Fail();
      }
      unpacked_ += static_cast<uint64_t>(count);
      if (unpacked_ > kMostUnpacked) {
        throw Fault(reason::kOversized,
                    "it unpacks to over " + std::to_string(kMostUnpacked >> 20) + " MiB");
      }
      if (!take({buffer, static_cast<size_t>(count)}, count == 0) || count == 0) {
        return;
      }
    }
  }

  // The bytes that were read of all parts.
  uint64_t Unpacked() const { return unpacked_; }

 private:
  [[noreturn]] void Fail() {
    const char* const text = archive_error_string(archive_.get());
    throw Fault(reason::kDamaged,
                "the archive cannot be read, " + std::string(text == nullptr ? "no ZIP" : text));
  }

  std::unique_ptr<struct archive, int (*)(struct archive*)> archive_;
  size_t entries_ = 0;
  uint64_t unpacked_ = 0;
  bool is_encrypted_ = false;
};

bool NeverEnough() { return false; }

void ReadXml(Archive& archive, XmlHandler& handler,
             const std::function<bool()>& is_enough = NeverEnough) {
  XmlReader reader(handler);
  archive.Read([&](std::string_view part, bool is_last) {
    reader.Feed(part, is_last);
    return !is_enough();
  });
}

// Whether the name is `before`, digits if any, and ".xml".
bool IsNumbered(std::string_view name, std::string_view before) {
  constexpr std::string_view kBehind = ".xml";
  return name.size() >= before.size() + kBehind.size() && name.starts_with(before) &&
         name.ends_with(kBehind) &&
         name.substr(before.size(), name.size() - before.size() - kBehind.size())
                 .find_first_not_of("0123456789") == std::string_view::npos;
}

// The parts of OOXML that hold text, by their names in lower case: it does not count, and whether
// there is a number is for each program to choose.
bool IsTextPart(std::string_view name) {
  constexpr std::string_view kParts[] = {"word/document",
                                         "word/footnotes",
                                         "word/endnotes",
                                         "word/comments",
                                         "word/header",
                                         "word/footer",
                                         "xl/sharedstrings",
                                         "xl/worksheets/sheet",
                                         "xl/comments",
                                         "xl/comments/comment",
                                         "xl/drawings/drawing",
                                         "ppt/slides/slide",
                                         "ppt/notesslides/notesslide",
                                         "ppt/diagrams/data"};
  return std::any_of(std::begin(kParts), std::end(kParts),
                     [name](std::string_view part) { return IsNumbered(name, part); }) ||
         (name.starts_with("ppt/comments/") && name.ends_with(".xml"));
}

// The part without which there is no document of the type.
struct Main {
  std::string_view part;  // Followed by a number, if any, and ".xml".
  const char* type;
};
constexpr Main kMains[] = {
    {"word/document", "application/vnd.openxmlformats-officedocument.wordprocessingml.document"},
    {"xl/workbook", "application/vnd.openxmlformats-officedocument.spreadsheetml.sheet"},
    {"ppt/presentation",
     "application/vnd.openxmlformats-officedocument.presentationml.presentation"},
};
// Of a workbook whose parts are not XML the properties are read, and its type is all besides.
constexpr std::string_view kBinaryWorkbook = "xl/workbook.bin";
constexpr char kBinaryWorkbookType[] = "application/vnd.ms-excel.sheet.binary.macroEnabled.12";

class PartReader {
 public:
  PartReader(std::string type, Document& document) : type_(std::move(type)), document_(document) {}

  void Read(const std::string& name, Archive& archive) {
    if (name == "mimetype") {
      ReadType(archive);
    }
    PropertyHandler properties(document_);
    if (type_.starts_with(kOpenDocument)) {
      if (name == "META-INF/manifest.xml") {
        ManifestHandler manifest;
        ReadXml(archive, manifest);
      } else if (name == "meta.xml") {
        ReadXml(archive, properties);
      } else if (name == "content.xml") {
        ReadText(/*is_open_document=*/true, archive);
      }
    } else if (type_ == kEpub) {
      ReadBookPart(ToLower(name), archive, properties);
    } else {
      ReadOpenXmlPart(ToLower(name), archive, properties);
    }
  }

  // For the end of the archive. Of a book with encrypted pages its properties remain: what was read
  // of pages before that was known is noise.
  void CheckEncryption() {
    if (is_encrypted_) {
      document_.text = Text();
      throw Fault(reason::kEncrypted, "the pages of the book are encrypted");
    }
  }

  // Puts the numbers of sheets behind the words of all parts: a large table would leave no room for
  // the words, which stand in a part behind it.
  void AppendNumbers() {
    if (!numbers_.Get().empty()) {
      document_.text.EndLine();
      document_.text.Append(numbers_.Get());
    }
    if (numbers_.IsFull()) {
      document_.text.SetTruncated();
    }
  }

  // Whether a part was there that only documents have.
  bool IsDocument() const { return is_document_; }
  // Whether the part was there that the text is in.
  bool HasText() const { return has_text_; }

 private:
  // Also where the archive's writer has left more at its beginning than the table of types allows.
  void ReadType(Archive& archive) {
    std::string type;
    archive.Read([&type](std::string_view part, bool /*is_last*/) {
      constexpr size_t kMost = 256;
      type += part.substr(0, kMost - std::min(kMost, type.size()));
      return true;
    });
    if (type.starts_with(kOpenDocument) || type == kEpub) {
      type_ = type;
      is_document_ = true;
      document_.SetText(field::KAVOMDContentType, type);
    }
  }

  // The names in lower case.
  void ReadBookPart(const std::string& name, Archive& archive, PropertyHandler& properties) {
    if (name.ends_with(".opf")) {
      ReadXml(archive, properties);
      has_text_ = true;
    } else if (name == "meta-inf/encryption.xml") {
      BookEncryptionHandler encryption;
      ReadXml(archive, encryption);
      is_encrypted_ = encryption.HasPages();
    } else if (IsPage(name) && !is_encrypted_ && !document_.text.IsFull()) {
      ReadPage(archive);
    }
  }

  void ReadOpenXmlPart(const std::string& name, Archive& archive, PropertyHandler& properties) {
    for (const Main& row : kMains) {
      if (IsNumbered(name, row.part)) {
        SetType(row.type);
      }
    }
    if (name == kBinaryWorkbook) {
      SetType(kBinaryWorkbookType);
    } else if (name == "docprops/core.xml" || name == "docprops/app.xml") {
      ReadXml(archive, properties);
    } else if (IsTextPart(name)) {
      ReadText(/*is_open_document=*/false, archive, name.starts_with("xl/worksheets/"));
    }
  }

  void SetType(const char* type) {
    document_.SetText(field::KAVOMDContentType, type);
    is_document_ = has_text_ = true;
  }

  // A sheet is left, when there is no room for its numbers, in time for the parts behind it.
  void ReadText(bool is_open_document, Archive& archive, bool is_sheet = false) {
    is_document_ = has_text_ = true;
    if (!document_.text.IsFull()) {
      TextHandler handler(is_open_document, document_.text, numbers_);
      ReadXml(archive, handler, [&] {
        return document_.text.IsFull() ||
               (is_sheet && numbers_.IsFull() && archive.Unpacked() > kMostUnpacked / 2);
      });
      document_.text.EndLine();
    }
  }

  void ReadPage(Archive& archive) {
    std::string page;
    archive.Read([&page](std::string_view part, bool /*is_last*/) {
      page += part;
      return page.size() <= kMostPageBytes;
    });
    AddHtml(page, /*is_whole=*/false, document_);
  }

  std::string type_;
  Document& document_;
  Text numbers_;
  bool is_encrypted_ = false;
  bool is_document_ = false;
  bool has_text_ = false;
};

}  // namespace

void ReadOffice(const Source& source, const std::string& type, Document& document) {
  const bool is_plain_archive = type == "application/zip" || type == "application/octet-stream";
  PartReader parts(type, document);
  // A part that is damaged does not take the others along.
  std::optional<Fault> fault;
  try {
    Archive archive(source);
    while (const std::optional<std::string> name = archive.Next()) {
      try {
        if (name->empty()) {
          throw Fault(reason::kDamaged, "the name of a part cannot be read");
        }
        parts.Read(*name, archive);
      } catch (const Fault& thrown) {
        if (thrown.Reason() != reason::kDamaged) {
          throw;
        }
        fault = fault ? fault : std::optional(thrown);
      }
    }
    parts.CheckEncryption();
  } catch (const Fault& thrown) {
    fault = thrown;
  }
  parts.AppendNumbers();
  if (is_plain_archive && !parts.IsDocument()) {
    return;  // What is in archives is not looked at, so nothing is missing.
  }
  if (fault) {
    throw Fault(*fault);
  }
  if (!parts.HasText()) {
    throw Fault(reason::kDamaged, "the part with the text is missing");
  }
}

}  // namespace vexlo::extractd
