// A root of its own for a test program: what stands before every fixed path.
#ifndef SUPPORT_PRIVATE_ROOT_H_
#define SUPPORT_PRIVATE_ROOT_H_

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>

#include "kavo/local/shares.h"
#include "support/temp_folder.h"

// One global in the program, so that it stands before anyone asks for the root. Ends the program
// when the build has no root, as the tests would write to the system's own files then.
class PrivateRoot {
 public:
  explicit PrivateRoot(const std::string& parent = "/tmp") : folder_(parent) {
    setenv("FILEINDEX_ROOT", folder_.Path().c_str(), /*overwrite=*/1);
    if (kavo::local::Root() != folder_.Path()) {
      std::fputs("configure this build with FILEINDEX_ROOT, as the presets do\n", stderr);
      std::_Exit(1);
    }
    std::filesystem::create_directories(folder_ / "etc/kavo");
  }

  const std::string& Path() const { return folder_.Path(); }
  std::string operator/(const std::string& name) const { return folder_ / name; }

  // The elements of the list in the shares file.
  void SetShares(const std::string& json) const {
    WriteText(kavo::local::SharesFile(), "{\"shares\": [" + json + "]}");
  }

  // Makes a folder below the root and gives its path.
  std::string MakeFolder(const std::string& name) const {
    std::filesystem::create_directories(folder_ / name);
    return folder_ / name;
  }

 private:
  const TempFolder folder_;
};

#endif  // SUPPORT_PRIVATE_ROOT_H_
