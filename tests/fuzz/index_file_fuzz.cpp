// An index whose database is damaged: four bytes of the input say where, and which bits of the byte
// there are others; none, that the file ends there. Whatever the engine makes of it, it says so,
// and the index can be made anew. A file that was cut off never gives other documents.
#include <filesystem>
#include <memory>

#include "common/file.h"
#include "fuzz/engine_index.h"
#include "fuzz/target.h"

namespace {

using vexlo::elasticd::Engine;

constexpr int kDamaged = 2005;
constexpr size_t kMostPlaces = 64;

// Whether nothing but the end of the file is missing.
bool Damage(const std::string& file, std::string_view places) {
  std::string bytes;
  fuzz::Require(vexlo::ReadFile(bytes, file) && !bytes.empty(), "the database cannot be read");
  bool is_only_cut = true;
  for (size_t i = 0; i < kMostPlaces && places.size() >= 4 && !bytes.empty(); ++i) {
    const auto byte = [&](size_t at) { return size_t{static_cast<unsigned char>(places[at])}; };
    const size_t at = (byte(0) << 16 | byte(1) << 8 | byte(2)) % bytes.size();
    if (places[3] == 0) {
      bytes.resize(at);
    } else {
      bytes[at] = static_cast<char>(bytes[at] ^ places[3]);
      is_only_cut = false;
    }
    places.remove_prefix(4);
  }
  fuzz::WriteFile(file, bytes);
  return is_only_cut;
}

// That the engine goes on: with an answer, or the news that the index is to be made anew.
bool Ask(Engine& engine, const std::string& command, const char* data) {
  Json::Value value;
  fuzz::Require(vexlo::JsonFromString(value, data), "the request is no JSON");
  const int code = fuzz::CodeOf(engine.Handle(fuzz::Request(command, value)));
  fuzz::Require((code >= 2004 && code <= 2011) || code == 0 || code == 2008,
                "damage is taken for something else");
  return code != kDamaged;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  fuzz::RestoreIndex();
  static const std::string want = [] {
    Engine engine(fuzz::Registry());
    return vexlo::JsonToString(fuzz::AllDocuments(engine));
  }();
  const std::string folder = fuzz::Folder() + fuzz::kIndexFolder;
  const bool is_only_cut = Damage(folder + "/index.db", fuzz::TextOf(data, size));
  auto engine = std::make_unique<Engine>(fuzz::Registry());
  const Json::Value all = fuzz::AllDocuments(*engine);
  if (fuzz::CodeOf(all) == 0 && is_only_cut) {
    fuzz::RequireEqual(vexlo::JsonToString(all), want, "a database that was cut off gives less");
  }
  const bool is_alive =
      Ask(*engine, "search", R"({"words":"fox quick*","name":"o","snippet":true,"ids":["i"]})") &&
      Ask(*engine, "document_get_by_query", R"({"query":{"qsl":{"term":{"KAVOMDFSSize":43}}}})") &&
      Ask(*engine, "document_set_by_id",
          R"({"doc_id":"/v/a/Fox.txt","data":{"KAVOMDPath":"/v/c","KAVOMDTextContent":"new"}})") &&
      Ask(*engine, "document_del_by_query",
          R"({"query":{"qsl":{"prefix":{"KAVOMDPath":"/v/b"}}}})") &&
      Ask(*engine, "commit", "{}");
  (void)is_alive;  // What is damaged answers nothing else any more.
  const int gone = fuzz::CodeOf(engine->Handle(fuzz::Request("index_delete", Json::objectValue)));
  fuzz::Require(gone == 0, "a damaged index cannot be deleted");
  fuzz::FillIndex(*engine);
  fuzz::RequireEqual(vexlo::JsonToString(fuzz::AllDocuments(*engine)), want,
                     "an index made anew has other documents");
  return 0;
}
