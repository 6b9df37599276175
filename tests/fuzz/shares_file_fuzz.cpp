// The shares file: what is taken from it keeps to its form, and stays as it is when an edit writes
// the file anew.
#include <algorithm>
#include <set>

#include "fuzz/target.h"
#include "kavo/local/shares.h"
#include "platform/local/shares_file.h"

namespace {

using kavo::local::Share;

void CheckForm(const std::vector<Share>& shares) {
  std::set<std::string> names;
  for (const Share& share : shares) {
    const size_t slash = share.path.rfind('/');
    fuzz::Require(!share.name.empty() && share.name.size() <= 255 &&
                      share.name.find('/') == std::string::npos && share.name != "." &&
                      share.name != "..",
                  "a share has a name that is none");
    fuzz::Require(share.path.starts_with('/') && share.path.find("//") == std::string::npos &&
                      share.path.find("/./") == std::string::npos &&
                      share.path.find("/../") == std::string::npos,
                  "a share has a path that is none");
    fuzz::RequireEqual(share.path.substr(slash + 1), share.name, "path and name differ");
    fuzz::Require(names.insert(share.name).second, "two shares have one name");
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string file = fuzz::Folder() + "/shares.json";
  kavo::local::SharesText read;
  read.exists = true;
  read.text = fuzz::TextOf(data, size);
  std::vector<Share> shares;
  try {
    shares = kavo::local::ParseShares(file, read);
  } catch (const kavo::local::SharesError& error) {
    fuzz::Require(std::string_view(error.what()).starts_with(file + ":"),
                  "a fault does not name the file");
    fuzz::Require(std::string_view(error.what()).find('\n') == std::string_view::npos,
                  "a fault has several lines");
    return 0;
  }
  CheckForm(shares);
  Share added;
  added.name = "added by the target";
  added.path = "/volume9/" + added.name;
  if (std::any_of(shares.begin(), shares.end(),
                  [&](const Share& share) { return share.name == added.name; })) {
    return 0;
  }
  fuzz::WriteFile(file, read.text);
  kavo::local::AddShare(file, added);
  shares.push_back(added);
  fuzz::Require(kavo::local::ReadShares(file) == shares, "an edit changes other shares");
  kavo::local::RemoveShare(file, added.name);
  shares.pop_back();
  fuzz::Require(kavo::local::ReadShares(file) == shares, "an edit taken back leaves a change");
  return 0;
}
