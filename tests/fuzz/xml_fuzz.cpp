// XML as it streams by: elements close in order, and it makes no difference how the bytes come.
#include <vector>

#include "daemons/kavocontentextractd/fault.h"
#include "daemons/kavocontentextractd/xml.h"
#include "fuzz/target.h"

namespace {

// Everything that was told, as a text.
class Recorder : public vexlo::extractd::XmlHandler {
 public:
  void Start(std::string_view name, const Attributes& attributes) override {
    open_.emplace_back(name);
    told_.append("\n<").append(name).append(" ").append(attributes.Get("val")).append(">\n");
  }
  void End(std::string_view name) override {
    fuzz::Require(!open_.empty() && open_.back() == name, "an element ends that was not begun");
    open_.pop_back();
    told_.append("\n</").append(name).append(">\n");
  }
  void Characters(std::string_view text) override { told_.append(text); }

  const std::string& Told() const { return told_; }
  bool AnyOpen() const { return !open_.empty(); }

 private:
  std::vector<std::string> open_;
  std::string told_;
};

// What was told, and whether all of it was XML.
std::pair<std::string, bool> Read(std::string_view text, size_t part_bytes) {
  Recorder recorder;
  vexlo::extractd::XmlReader reader(recorder);
  try {
    do {
      const std::string_view part = text.substr(0, part_bytes);
      text.remove_prefix(part.size());
      reader.Feed(part, /*is_last=*/text.empty());
    } while (!text.empty());
  } catch (const vexlo::extractd::Fault& fault) {
    fuzz::Require(fault.Reason() == "damaged", "bad XML is something else than damage");
    return {recorder.Told(), false};
  }
  fuzz::Require(!recorder.AnyOpen(), "an element never ends");
  fuzz::Require(fuzz::IsUtf8(recorder.Told()), "XML tells something else than UTF-8");
  return {recorder.Told(), true};
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view text = fuzz::TextOf(data, size);
  const auto [whole, is_whole_good] = Read(text, size + 1);
  const auto [parts, is_good] = Read(text, 7);
  fuzz::Require(is_good == is_whole_good, "the same XML is good and bad");
  if (is_good) {
    fuzz::RequireEqual(parts, whole, "the same XML tells two things");
  }
  return 0;
}
