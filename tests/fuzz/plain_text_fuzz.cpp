// Plain text in any encoding: what is text already stays as it is.
#include "daemons/kavocontentextractd/formats.h"
#include "daemons/kavocontentextractd/plain_text.h"
#include "fuzz/format.h"
#include "fuzz/target.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  namespace extractd = vexlo::extractd;
  // What is no text, and the escape sequences of Japanese mail, which are text in another encoding.
  constexpr std::string_view kOtherMeaning("\0\x1B", 2);
  const std::string_view bytes = fuzz::TextOf(data, size);
  fuzz::Require(extractd::IsUtf8(bytes, /*has_more=*/false) == fuzz::IsUtf8(bytes),
                "what is UTF-8 is judged otherwise");
  for (const bool has_more : {false, true}) {
    const auto text = extractd::DecodeText(bytes, has_more);
    fuzz::Require(!text || fuzz::IsUtf8(*text), "what was decoded is no UTF-8");
    if (!has_more && fuzz::IsUtf8(bytes) && !extractd::HasBinaryControls(bytes) &&
        bytes.find_first_of(kOtherMeaning) == std::string_view::npos) {
      fuzz::Require(text.has_value(), "text is taken for none");
      fuzz::RequireEqual(*text,
                         std::string(bytes.substr(bytes.starts_with("\xEF\xBB\xBF") ? 3 : 0)),
                         "UTF-8 is another text when it was decoded");
    }
  }
  fuzz::CheckReader([](const extractd::Source& source, const std::string& /*type*/,
                       extractd::Document& document) { extractd::ReadPlainText(source, document); },
                    "text/plain", bytes);
  return 0;
}
