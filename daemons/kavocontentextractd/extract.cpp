#include "daemons/kavocontentextractd/extract.h"

#include <magic.h>

#include <algorithm>
#include <exception>
#include <iterator>
#include <new>
#include <stdexcept>
#include <string_view>

#include "daemons/kavocontentextractd/document.h"
#include "daemons/kavocontentextractd/fault.h"
#include "daemons/kavocontentextractd/formats.h"
#include "daemons/kavocontentextractd/source.h"
#include "fileindex/elastic_control/schema.h"
#include "kavo/local/content.h"

namespace vexlo::extractd {
namespace {

namespace field = fileindex::elastic::field;
namespace reason = kavo::local::content_reason;

constexpr size_t kHeadBytes = size_t{64} << 10;

struct Format {
  std::string_view type;  // A media type, or its beginning up to "/".
  void (*read)(const Source& source, const std::string& type, Document& document);
};
constexpr Format kFormats[] = {
    {"application/pdf", ReadPdf},
};

// The first row that fits counts.
const Format* FindFormat(std::string_view type) {
  const Format* const found =
      std::find_if(std::begin(kFormats), std::end(kFormats), [type](const Format& row) {
        return row.type.ends_with('/') ? type.starts_with(row.type) : type == row.type;
      });
  return found == std::end(kFormats) ? nullptr : found;
}

void Read(const Source& source, const std::string& type, Document& document) {
  if (const Format* const format = FindFormat(type)) {
    document.SetText(field::KAVOMDContentType, type);
    format->read(source, type, document);
  } else if (ReadPlainText(source, document)) {
    document.SetText(field::KAVOMDContentType, "text/plain");
  } else {
    document.SetText(field::KAVOMDContentType, type);
  }
}

}  // namespace

Extractor::Extractor()
    : types_(magic_open(MAGIC_MIME_TYPE | MAGIC_NO_CHECK_COMPRESS | MAGIC_NO_CHECK_TAR |
                        MAGIC_NO_CHECK_ELF | MAGIC_NO_CHECK_CDF | MAGIC_NO_CHECK_JSON |
                        MAGIC_NO_CHECK_CSV),
             magic_close) {
  if (types_ == nullptr || magic_load(types_.get(), nullptr) != 0) {
    throw std::runtime_error("the table of file types cannot be loaded");
  }
}

Json::Value Extractor::Extract(int file, const std::string& name) const {
  Document document;
  Fault fault("", "");
  try {
    const Source source(file, name);
    const std::string head = source.Read(kHeadBytes);
    const char* const type = magic_buffer(types_.get(), head.data(), head.size());
    Read(source, type == nullptr ? "application/octet-stream" : type, document);
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
