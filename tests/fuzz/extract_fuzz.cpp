// A file of any type. The first byte of the input chooses the extension of its name.
#include <new>

#include "daemons/kavocontentextractd/extract.h"
#include "fuzz/format.h"
#include "fuzz/target.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static const vexlo::extractd::Extractor extractor;
  static const char* const kNames[] = {"a", "a.txt", "a.html", "a.svg", "a.mp3", "a.docx", "a.jpg"};
  if (size == 0) {
    return 0;
  }
  try {
    const Json::Value fields = extractor.Extract(fuzz::FileOf(fuzz::TextOf(data + 1, size - 1)),
                                                 kNames[*data % std::size(kNames)]);
    if (fields.isMember("error")) {
      fuzz::Require(fields.size() == 1 && fields["error"]["reason"].isString(),
                    "a failure has no reason, or fields besides");
    }
    fuzz::CheckFields(fields);
  } catch (const std::bad_alloc&) {
    return 0;  // The process that reads a file ends then.
  }
  return 0;
}
