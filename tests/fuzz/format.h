// What the targets of the content readers share.
#ifndef FUZZ_FORMAT_H_
#define FUZZ_FORMAT_H_

#include <json/value.h>

#include <string>
#include <string_view>

#include "daemons/kavocontentextractd/document.h"
#include "daemons/kavocontentextractd/source.h"
#include "fuzz/target.h"

namespace fuzz {

// A descriptor of a file in memory that holds the bytes, the same one at each call.
int FileOf(std::string_view bytes);

// Requires that what is shown of a file is text: UTF-8 without control characters but white space,
// no longer than the readers promise, and the same when it was sent as JSON.
void CheckFields(const Json::Value& fields);

using Reader = void (*)(const vexlo::extractd::Source& source, const std::string& type,
                        vexlo::extractd::Document& document);

// Reads the bytes as a file of that media type, and checks what comes out.
void CheckReader(Reader reader, const char* type, std::string_view bytes);

}  // namespace fuzz

// The whole of a target that gives its input to such a reader.
#define FUZZ_READER(reader, type)                                           \
  extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) { \
    fuzz::CheckReader(reader, type, fuzz::TextOf(data, size));              \
    return 0;                                                               \
  }

#endif  // FUZZ_FORMAT_H_
