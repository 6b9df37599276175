// Random queues, folded by the tree and by its naive twin.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <iterator>
#include <random>
#include <string>
#include <string_view>
#include <vector>

#include "support/naive_tree.h"
#include "support/queue_file.h"
#include "support/temp_folder.h"

namespace {

constexpr unsigned kSeeds = 5000;

using Strings = std::vector<std::string>;

// Writes queues in which paths collide often, in all the spellings that JSON has for one thing.
class QueueWriter {
 public:
  explicit QueueWriter(unsigned seed) : seed_(seed), random_(seed) {}

  Strings Queue() {
    Strings lines;
    for (unsigned i = wide_ ? 200 + Below(100) : 0; i > 0; --i) {
      lines.push_back(R"({"path":"/w/)" + std::to_string(i) + R"(","event":)" +
                      Any("2|4|64|128|128|65536|131072|") + "}");
    }
    for (unsigned i = 1 + Below(wide_ || sane_ ? 60 : 40); i > 0; --i) {
      lines.push_back(OneIn(12) ? BadLine() : GoodLine());
    }
    return lines;
  }

  bool OneIn(unsigned n) { return Below(n) == 0; }

 private:
  unsigned Below(size_t n) { return static_cast<unsigned>(random_() % n); }

  // One of the texts, which stand with a "|" behind each.
  std::string Any(std::string_view texts) {
    const auto count = static_cast<size_t>(std::count(texts.begin(), texts.end(), '|'));
    for (unsigned skip = Below(count); skip > 0; --skip) {
      texts.remove_prefix(texts.find('|') + 1);
    }
    return std::string(texts.substr(0, texts.find('|')));
  }

  std::string Name() {
    return OneIn(12)
               ? Any("\xC3\xA9|caf\xE9|\xF0\x9F\x98\x80|a b|q\"\\|l\nf|\xED\xA0\x80|.|\x01|..|{}|")
               : Any("a|b|c|");
  }

  std::string GoodPath() {
    std::string path = wide_ ? "/w/" + std::to_string(Below(400)) : "/" + Name();
    for (unsigned i = deep_ && OneIn(3) ? Below(OneIn(3) ? 150 : 8) : 0; i > 0; --i) {
      path += "/d";
    }
    while (path.size() < 40 && OneIn(2)) {
      path += "/" + Name();
    }
    return wide_ && OneIn(4) ? Any("/w|/w|/x|/a|/a/b|") : path;
  }

  std::string Path() {
    const std::string path = GoodPath();
    const std::string odd[] = {"",
                               "/",
                               path + "/",
                               "/" + path,
                               path.substr(1),
                               path + "//a",
                               path + std::string("\0z", 2)};
    return OneIn(20) ? odd[Below(std::size(odd))] : path;
  }

  uint32_t Mask() {
    uint32_t mask = 0;
    do {
      mask |= static_cast<uint32_t>(
          std::stoul(Any("2|4|8|64|64|128|128|128|256|256|256|65536|131072|131072|")));
    } while (OneIn(5));
    mask |= OneIn(30) ? 1U << Below(32) & ~0x200U : 0;
    mask |= crashing_ && OneIn(15) ? 0x200U : 0;
    if ((mask & 0x100) != 0 && renames_left_-- == 0) {
      renames_left_ = 0;
      mask ^= 0x100U;
    }
    return OneIn(60) ? 0 : mask;
  }

  // A JSON string for the bytes, any of its characters escaped in any way.
  std::string Quoted(const std::string& text) {
    static constexpr std::string_view kSpellings[][2] = {{"\xC3\xA9", "\\u00e9"},
                                                         {"\xF0\x9F\x98\x80", "\\ud83d\\uDE00"},
                                                         {"/", "\\/"},
                                                         {"\"", "\\\""},
                                                         {"\\", "\\\\"},
                                                         {"\n", "\\n"}};
    std::string quoted = "\"";
    for (size_t i = 0; i < text.size(); ++i) {
      const auto byte = static_cast<unsigned char>(text[i]);
      const auto& [bytes, escaped] = kSpellings[Below(std::size(kSpellings))];
      if (text.compare(i, bytes.size(), bytes) == 0) {
        quoted += escaped;
        i += bytes.size() - 1;
      } else if (byte < ' ' || byte == '"' || byte == '\\' || (byte < 0x7F && OneIn(60))) {
        char hex[8];
        snprintf(hex, sizeof(hex), OneIn(2) ? "\\u%04x" : "\\u%04X", byte);
        quoted += hex;
      } else {
        quoted += text[i];
      }
    }
    return quoted + "\"";
  }

  std::string Number(uint32_t value) {
    static constexpr char kOdd[] =
        "#.0|#e0|#.75|0#|\"#\"|true|null|-1|4294967296|1e1|1e-1|[8]|6.4E1|4294966527|2E|8.|1e99|";
    std::string text = OneIn(10) ? Any(crashing_ && OneIn(6) ? "5.12e2|4294967039|" : kOdd) : "#";
    const size_t at = text.find('#');
    return at == std::string::npos ? text : text.replace(at, 1, std::to_string(value));
  }

  std::string Data() {
    Strings members;
    for (const char* key : {"document", "audio", "video", "photo", "basic", "other"}) {
      members.push_back(
          Member(key, Any(R"(true|true|false|1|-2|0|null|"true"|{"a":[]}|[true]|2.50|)")));
    }
    members.resize(Below(7));
    return OneIn(4) ? Any(R"(null|"x"|[1,{"photo":true}]|5|true|{}|-0.0|18446744073709551615|)")
                    : Object(members);
  }

  std::string Blank() { return spacing_ == 2 && OneIn(2) ? Any(" |\t|  |\r| \t |") : ""; }
  std::string Behind() { return spacing_ == 1 ? " " : Blank(); }

  std::string Object(Strings members) {
    if (spacing_ != 1 || OneIn(2)) {
      std::shuffle(members.begin(), members.end(), random_);
    }
    std::string text = Blank() + "{" + Blank();
    for (const std::string& member : members) {
      text += (&member == members.data() ? "" : Blank() + "," + Behind()) + member;
    }
    return text + Blank() + "}" + Blank();
  }

  std::string Member(const std::string& key, const std::string& value) {
    return (OneIn(60) ? Quoted(key) : "\"" + key + "\"") + Blank() + ":" + Behind() + value;
  }

  std::string GoodLine() {
    spacing_ = Below(3);
    const uint32_t mask = Mask();
    const bool renames = (mask & 0x100) != 0;
    const std::string path = Path();
    std::string old_path = OldPath(path);
    while (sane_ && !path.empty() && (IsBelow(path, old_path) || IsBelow(old_path, path))) {
      old_path = GoodPath();
    }
    if (renames && IsBelow(path, old_path) && nested_left_-- == 0) {
      nested_left_ = 0;
      old_path = "/q";
    }
    Strings members = {Member("event", Number(mask)),
                       Member("path", OneIn(200) ? "null" : Quoted(path))};
    const auto add = [&](bool wanted, const std::string& member) {
      members.insert(members.end(), wanted ? 1 : 0, member);
    };
    add(OneIn(3), Member("is_dir", Any("true|true|true|1|1.0|-2|true |false|0|null|\"true\"|{}|")));
    add(renames || OneIn(20),
        Member("path_old", old_path.empty() && OneIn(2) ? "null" : Quoted(old_path)));
    add((mask & 0x20000) != 0 ? !OneIn(12) : OneIn(12), Member("data", Data()));
    add(OneIn(12),
        Any("\"time\":12|\"Path\":\"/a\"|\"\":[{}]|\"x\":{\"event\":2,\"path\":\"/c\"}|"));
    add(OneIn(40), members[Below(members.size())]);
    add(OneIn(40), Member("path", Quoted(Path())));
    return Object(members) + (OneIn(20) ? "\r" : "");
  }

  static bool IsBelow(const std::string& path, const std::string& folder) {
    return (path + "/").starts_with(folder + "/");
  }

  std::string OldPath(const std::string& path) {
    const std::string parent = path.substr(0, std::min(path.rfind('/'), path.size()));
    const std::string near[] = {path, path + "/" + Name(), parent, OneIn(20) ? "" : Path()};
    return near[std::min(Below(10), 3U)];
  }

  std::string BadLine() {
    const std::string line = GoodLine();
    const size_t at = Below(line.size());
    const std::string other(1, static_cast<char>(11 + Below(245)));
    const size_t levels = OneIn(10) ? 997 + Below(5) : 1;
    const std::string nested = std::string(levels, '[') + std::string(levels, ']');
    const std::string texts =
        Any(R"("/a\x"|"/a\u00g0"|"/a\ud800"|"/a\ud800\u0041"|"/a\udc00"|5|true|["/a"]|)");
    const std::string tails = Any(
        R"(,}|}x|}]|} // c|,"x":1e999}|,"x":nul}|,"x":[1,]}|,"x":"\q"}|,"x":01}|,'x':1}|,x:1}|)");
    const std::string events = Any("+2|0x2|NaN|tru|2 2|");
    const std::string kinds[] = {
        line.substr(0, at),
        line.substr(at),
        std::string(line).replace(at, 1, other),
        line + GoodLine(),
        line + std::string("\0}", Below(3)),
        R"({"event":64,"path":"/a","data":)" + nested + "}",
        R"({"event":2,"path":)" + texts + "}",
        R"({"event":2,"path":"/a")" + tails,
        R"({"path":"/a","event":)" + events + "}",
        Any("| |nonsense|{|[]|5|null|\"{}\"|{\"event\":2}|{\"path\":\"/a\"}|/* c "
            "*/{}|\xEF\xBB\xBF{}|{\"path\":\"/a\tb\"}|")};
    return kinds[Below(std::size(kinds))];
  }

  unsigned seed_;
  std::mt19937 random_;
  bool wide_ = seed_ % 25 == 1;
  bool deep_ = seed_ % 50 == 2;
  bool crashing_ = seed_ % 20 == 3;
  bool sane_ = seed_ % 2 == 0;  // Renames as file systems make them: never into each other.
  // A rename leaves the nodes that it empties: a few that nest make a tree of millions.
  unsigned renames_left_ = sane_ ? 12 : wide_ ? 3 : 8;
  unsigned nested_left_ = wide_ ? 1 : 2;
  unsigned spacing_ = 0;  // 0 compact, 1 behind every sign, 2 anywhere.
};

std::string Describe(const naive::Result& result) {
  return "count " + std::to_string(result.count) + (result.crashed ? ", crashed\n" : "\n") +
         Join(result.delivered) + "skipped:\n" + Join(result.skipped);
}

// What the tree and its twin say where that differs; else nothing.
std::string Difference(const std::string& file, const Strings& lines, bool torn,
                       const naive::Result& want) {
  std::string content = Join(lines);
  content.resize(content.size() - (torn ? 1 : 0));
  WriteText(file, content);
  const std::string wanted = Describe(want);
  const std::string got = want.endless ? wanted : Describe(FoldFile(file));
  return got == wanted ? "" : "want: " + wanted + "got: " + got;
}

TEST(OPTreeOracle, RandomQueuesFoldAlike) {
  const TempFolder folder;
  const std::string file = folder / "queue";
  size_t delivered = 0;
  size_t skipped = 0;
  size_t endless = 0;
  for (unsigned seed = 0; seed < kSeeds; ++seed) {
    SCOPED_TRACE(seed);
    QueueWriter writer(seed);
    const Strings lines = writer.Queue();
    const bool torn = !lines.back().empty() && writer.OneIn(4);
    const naive::Result want = naive::Fold(lines);
    delivered += want.delivered.size();
    skipped += want.skipped.size();
    endless += want.endless ? 1 : 0;
    ASSERT_EQ(Difference(file, lines, torn, want), "")
        << (torn ? "torn lines:\n" : "lines:\n") << Join(lines);
  }
  // The queues are of use only while most lines leave something behind.
  EXPECT_GT(delivered, kSeeds * 4U);
  EXPECT_GT(skipped, kSeeds / 2U);
  EXPECT_LT(endless, kSeeds / 20U);
}

}  // namespace
