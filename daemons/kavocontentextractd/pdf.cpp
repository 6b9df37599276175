// PDF by poppler.
#include <poppler-document.h>
#include <poppler-global.h>
#include <poppler-page.h>

#include <algorithm>
#include <climits>
#include <memory>

#include "daemons/kavocontentextractd/fault.h"
#include "daemons/kavocontentextractd/formats.h"
#include "fileindex/elastic_control/schema.h"
#include "kavo/local/content.h"

namespace vexlo::extractd {
namespace {

namespace field = fileindex::elastic::field;
namespace reason = kavo::local::content_reason;

// The library takes the length as an int; the address space ends long before.
constexpr size_t kMostBytes = INT_MAX;

struct Info {
  const char* key;
  const char* field;
};
constexpr Info kInfos[] = {
    {"Title", field::KAVOMDTitle},     {"Author", field::KAVOMDAuthors},
    {"Subject", field::KAVOMDSubject}, {"Keywords", field::KAVOMDKeywords},
    {"Creator", field::KAVOMDCreator}, {"Producer", field::KAVOMDEncodingApplications},
};

std::string Utf8(const poppler::ustring& text) {
  const poppler::byte_array bytes = text.to_utf8();
  return {bytes.begin(), bytes.end()};
}

void ReadInfo(const poppler::document& pdf, Document& document) {
  for (const Info& info : kInfos) {
    document.SetText(info.field, Utf8(pdf.info_key(info.key)));
  }
  document.SetNumber(field::KAVOMDContentCreationDate,
                     static_cast<int64_t>(pdf.info_date_t("CreationDate")));
  int major = 0;
  int minor = 0;
  pdf.get_pdf_version(&major, &minor);
  document.SetText(field::KAVOMDVersion, std::to_string(major) + "." + std::to_string(minor));
  document.SetNumber(field::KAVOMDNumberOfPages, pdf.pages());
  if (pdf.is_encrypted()) {
    document.SetText(field::KAVOMDSecurityMethod, "Password Encrypted");
  }
}

}  // namespace

void ReadPdf(const Source& source, const std::string& /*type*/, Document& document) {
  poppler::set_debug_error_function([](const std::string&, void*) {}, nullptr);
  const Mapping file(source, kMostBytes);
  const std::unique_ptr<poppler::document> pdf(poppler::document::load_from_raw_data(
      file.Bytes().data(), static_cast<int>(file.Bytes().size())));
  if (pdf == nullptr) {
    throw Fault(reason::kDamaged, "the PDF cannot be read");
  }
  if (pdf->is_locked()) {
    document.SetText(field::KAVOMDSecurityMethod, "Password Encrypted");
    throw Fault(reason::kEncrypted, "the PDF wants a password");
  }
  ReadInfo(*pdf, document);
  int unreadable = 0;
  for (int i = 0; i < pdf->pages() && !document.text.IsFull(); ++i) {
    const std::unique_ptr<poppler::page> page(pdf->create_page(i));
    if (page == nullptr) {
      ++unreadable;
      continue;
    }
    if (i == 0) {
      const poppler::rectf size = page->page_rect();
      document.SetReal(field::KAVOMDPageWidth, size.width());
      document.SetReal(field::KAVOMDPageHeight, size.height());
    }
    std::string text = Utf8(page->text());
    text.erase(text.find_last_not_of('\f') + 1);  // Every page ends in it.
    document.text.Append(text);
    document.text.EndLine();
  }
  if (unreadable > 0) {
    throw Fault(reason::kDamaged, std::to_string(unreadable) + " pages cannot be read");
  }
}

}  // namespace vexlo::extractd
