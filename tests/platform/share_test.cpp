#include "kavo/share.h"

#include <gtest/gtest.h>
#include <sys/statvfs.h>

#include <atomic>
#include <climits>
#include <memory>
#include <stdexcept>
#include <thread>
#include <tuple>
#include <vector>

#include "kavo/index_path.h"
#include "kavo/last_error.h"
#include "kavo/local/shares.h"
#include "support/faults.h"
#include "support/syslog_capture.h"
#include "support/temp_folder.h"

FAULTABLE(ssize_t, read, (int fd, void* buffer, size_t size), (fd, buffer, size))

// A file system whose time stamps tell seconds, as a few do.
template <typename File>
int CoarseStat(int (*real)(File, struct stat*), File file, struct stat* info) {
  const int result = real(file, info);
  info->st_mtim.tv_nsec = info->st_ctim.tv_nsec = 0;
  return result;
}
INTERPOSED int stat(const char* path, struct stat* info) noexcept {
  return CoarseStat(REAL_FUNCTION(int, stat, (const char*, struct stat*)), path, info);
}
INTERPOSED int fstat(int fd, struct stat* info) noexcept {
  return CoarseStat(REAL_FUNCTION(int, fstat, (int, struct stat*)), fd, info);
}

// One file system is mounted read-only, whatever the machine has.
INTERPOSED int statvfs(const char* path, struct statvfs* info) {
  *info = {};
  info->f_flag = strcmp(path, "/volume2/mounted") == 0 ? ST_RDONLY : 0;
  return ScopedFault::Fires("statvfs") ? -1 : 0;
}

namespace {

const TempFolder kRoot;
const bool kIsRootSet = setenv("FILEINDEX_ROOT", kRoot.Path().c_str(), 1) == 0;

class Shares : public testing::Test {
 protected:
  void SetUp() override {
    if (kavo::local::Root() != kRoot.Path()) {
      GTEST_SKIP() << "a build for the system's own root looks nowhere else";
    }
    std::filesystem::create_directories(kRoot / "etc/kavo");
    Replace(R"({"shares": [
      {"name": "photo", "path": "/volume1/photo", "read_only": true, "ftp_privilege": 7},
      {"name": "homes", "path": "/volume1/homes", "recycle": true},
      {"name": "inner", "path": "/volume1/photo/a/inner", "encryption": true},
      {"name": "mounted", "path": "/volume2/mounted", "encrypted": true, "hide_unreadable": true}
    ]})");
  }
  void TearDown() override { std::filesystem::remove_all(kRoot / "etc"); }

  static void Replace(const std::string& text) {
    WriteText(kFile + ".new", text);
    ASSERT_EQ(rename((kFile + ".new").c_str(), kFile.c_str()), 0);
  }
  static std::string HolderOf(const std::string& path) {
    char name[256];
    char folder[4096];
    return KAVOShareNamePathGet(path.c_str(), name, sizeof(name), folder, sizeof(folder)) == 0
               ? std::string(name) + " " + folder
               : "";
  }

  static inline const std::string kFile = kRoot / "etc/kavo/shares.json";
};

using Record = std::unique_ptr<KAVO_SHARE, decltype(&KAVOShareFree)>;
using List = std::unique_ptr<KLIBCSZLIST, decltype(&KLIBCSzListFree)>;

Record Get(const char* name) {
  KAVO_SHARE* record = nullptr;
  KAVOShareGet(name, &record);
  return {record, &KAVOShareFree};
}

}  // namespace

TEST_F(Shares, PathsFindTheirShare) {
  const std::string photo = "/volume1/photo";
  for (const auto& [path, holder, in_bin, in_home_bin] :
       std::vector<std::tuple<std::string, const char*, int, int>>{
           {photo, "photo /volume1/photo", 0, 0},
           {photo + "X", "", 0, 0},
           {"/volume1", "", 0, 0},
           {"", "", 0, 0},
           {photo + "/" + std::string(1'000'000, 'x'), "photo /volume1/photo", 0, 0},
           {photo + "/a/inner/b/c", "inner /volume1/photo/a/inner", 0, 0},
           {photo + "/a/innermost", "photo /volume1/photo", 0, 0},
           {photo + "/#recycle/a/b", "photo /volume1/photo", 1, 0},
           {photo + "/#recycled", "photo /volume1/photo", 0, 0},
           {photo + "/a/inner/#recycle/b", "inner /volume1/photo/a/inner", 1, 0},
           {"/volume1/homes/#recycle/#recycle", "homes /volume1/homes", 1, 1},
           {"/volume1/homes/ann/#recycle", "homes /volume1/homes", 0, 1},
           {"/volume1/homes/ann/x/#recycle", "homes /volume1/homes", 0, 0},
       }) {
    EXPECT_EQ(HolderOf(path), holder) << path.substr(0, 50);
    EXPECT_EQ(KAVOShareIsShareRecycle(path.c_str()), in_bin) << path.substr(0, 50);
    EXPECT_EQ(KAVORecycleUserHomePathIsExist(path.c_str(), 11), in_home_bin) << path.substr(0, 50);
  }
  for (const auto& [name_bytes, path_bytes, want] :
       {std::tuple{6, 15, 0}, {5, 15, -1}, {6, 14, -1}, {-1, 15, -1}, {6, INT_MIN, -1}}) {
    char name[8] = "before";
    char folder[16] = "before";
    EXPECT_EQ(KAVOShareNamePathGet("/volume1/photo/x", name, name_bytes, folder, path_bytes), want);
    EXPECT_EQ(std::string(name) + folder, want == 0 ? "photo/volume1/photo" : "beforebefore");
    EXPECT_TRUE(want == 0 || errno == ERANGE);
  }
}

TEST_F(Shares, SettingsAreThoseOfThePresentFile) {
  const auto settings = [](const KAVO_SHARE* share) {
    std::string bits;
    for (const auto ask :
         {KLIBShareIsEncryptedGet, KLIBShareIsEncryptionGet, KLIBShareIsReadOnlyGet,
          KLIBShareRecycleStatusGet, KLIBShareHideUnreadableGet}) {
      int answer = 9;
      const int result = ask(share, &answer);
      bits += result == 0 ? std::to_string(answer) : answer == 9 ? "-" : "?";
    }
    return bits;
  };
  const Record photo = Get("photo");
  ASSERT_NE(photo, nullptr);
  EXPECT_EQ(photo->szName + std::string(photo->szPath), "photo/volume1/photo");
  EXPECT_EQ(photo->ftpPrivilege, 7U);
  EXPECT_EQ(settings(photo.get()), "00100");
  EXPECT_EQ(settings(Get("homes").get()), "00010");
  EXPECT_EQ(settings(Get("mounted").get()), "10101");
  {
    const ScopedFault fault("statvfs", ENOENT, 1, /*lasting=*/true);
    EXPECT_EQ(settings(photo.get()), "00100") << "the flag needs no file system";
    EXPECT_EQ(settings(Get("homes").get()), "00-10");
    EXPECT_EQ(KLIBCErrGet(), KAVO_ERR_SYSTEM);
    EXPECT_EQ(settings(Get("mounted").get()), "10001") << "its folder may be away while locked";
  }
  EXPECT_EQ(Get("Photo"), nullptr);
  EXPECT_EQ(KLIBCErrGet(), KAVO_ERR_NOT_FOUND);
  kavo::local::RemoveShare(kFile, "photo");
  kavo::local::AddShare(kFile, {.name = "photo", .path = "/volume3/photo", .recycle = true});
  EXPECT_EQ(settings(photo.get()), "00010");
  unlink(kFile.c_str());
  EXPECT_EQ(settings(photo.get()), "-----");
  EXPECT_EQ(KLIBCErrGet(), KAVO_ERR_NOT_FOUND);
}

TEST_F(Shares, EnumerationAppends) {
  const List list(KLIBCSzListAlloc(0), &KLIBCSzListFree);
  KLIBCSZLIST* into = list.get();
  const auto enumerate = [&into](int (*filter)(const KAVO_SHARE*)) {
    const KLIB_SHARE_ENUM which = {filter, 0};
    return KLIBShareEnum(&into, &which);
  };
  for (int i = 0; i < 100; i += 4) {  // Far over the list's first room.
    ASSERT_EQ(enumerate(nullptr), 4);
  }
  EXPECT_EQ(enumerate([](const KAVO_SHARE* share) -> int {
              return share->szName[0] == 'i' ? throw std::runtime_error("stop") : 0;
            }),
            -1);
  EXPECT_EQ(into->nItem, 100) << "what was appended before the fault is off again";
  EXPECT_EQ(enumerate([](const KAVO_SHARE* share) { return share->szName[0] == 'h' ? 0 : 1; }), 1);
  EXPECT_STREQ(KLIBCSzListGet(into, 98), "inner");
  EXPECT_STREQ(KLIBCSzListGet(into, 100), "homes");
}

TEST_F(Shares, ChangesAreSeenAtOnce) {
  const auto only = [](const std::string& path) {
    return "{\"shares\": [{\"name\": \"x\", \"path\": \"" + path + "\"}]}";
  };
  for (int i = 100; i < 300; ++i) {
    // Same size, same inode, and mostly the same time stamps.
    const std::string path = "/v" + std::to_string(i) + "/x";
    WriteText(kFile, only(path));
    ASSERT_EQ(HolderOf(path), "x " + path);
  }
  // Once the file is older than a tick, it is not read again until it changes.
  std::this_thread::sleep_for(std::chrono::milliseconds(2100));
  EXPECT_EQ(HolderOf("/v299/x"), "x /v299/x");
  {
    const ScopedFault fault("read", EIO, 1, /*lasting=*/true);
    EXPECT_EQ(HolderOf("/v299/x"), "x /v299/x");
    EXPECT_FALSE(fault.Fired());
    Replace(only("/v300/x"));
    EXPECT_EQ(HolderOf("/v300/x"), "");
    EXPECT_EQ(KLIBCErrGet(), KAVO_ERR_BAD_CONFIG);
    EXPECT_EQ(errno, EIO);
  }
  EXPECT_EQ(HolderOf("/v300/x"), "x /v300/x") << "a failure to read is not kept";
}

TEST_F(Shares, ABadFileFailsEveryCallAndIsLoggedOnce) {
  const Record photo = Get("photo");
  const List list(KLIBCSzListAlloc(0), &KLIBCSzListFree);
  const auto fails = [&] {
    int answer = 9;
    char text[99] = "before";
    KLIBCSZLIST* into = list.get();
    const KLIB_SHARE_ENUM all = {nullptr, 0};
    const bool all_fail = Get("photo") == nullptr &&
                          KLIBShareIsEncryptedGet(photo.get(), &answer) < 0 &&
                          KLIBShareIsReadOnlyGet(photo.get(), &answer) < 0 && answer == 9 &&
                          KLIBShareEnum(&into, &all) < 0 && into->nItem == 0 &&
                          KAVOShareNamePathGet("/volume1/photo", text, 99, text, 99) < 0 &&
                          KAVOShareIsShareRecycle("/volume1/photo") < 0 &&
                          KAVORecycleUserHomePathIsExist("/volume1/homes", 11) < 0;
    return all_fail && KLIBCErrGet() == KAVO_ERR_BAD_CONFIG && std::string(text) == "before";
  };
  SyslogCapture log;
  const std::string line = "<3>kavoplatform: " + kFile + ":1: \"shares\" must be a list";
  for (const char* const bad : {"{}", "{ }"}) {
    Replace(bad);
    EXPECT_TRUE(fails() && fails());
    EXPECT_EQ(log.Take(), std::vector<std::string>{line});
  }
  unlink(kFile.c_str());
  EXPECT_EQ(KAVOShareIsShareRecycle("/volume1/photo"), 0) << "no file: no shares";
  EXPECT_TRUE(log.Take().empty());
}

TEST_F(Shares, ThreadsAskWhileTheFileChanges) {
  std::atomic<bool> is_done = false;
  std::jthread threads[4];
  for (std::jthread& thread : threads) {
    thread = std::jthread([&is_done] {
      while (!is_done) {
        EXPECT_EQ(HolderOf("/volume1/homes/ann"), "homes /volume1/homes");
      }
    });
  }
  for (int i = 0; i < 20; ++i) {
    kavo::local::AddShare(kFile, {.name = "new", .path = "/volume1/homes/new"});
    kavo::local::RemoveShare(kFile, "new");
  }
  is_done = true;
}

TEST_F(Shares, QueueAndIndexHaveAPlace) {
  const std::string longest = "/" + std::string(237, 'n');
  for (const auto& [path, name, error] : std::vector<std::tuple<std::string, std::string, int>>{
           {"/volume1/photo", "%2Fvolume1%2Fphoto", 0},
           {"/caf\xE9 \n\x7f", "%2Fcaf\xE9 %0A%7F", 0},
           {"/v.tmp/a.tmp", "%2Fv.tmp%2Fa%2Etmp", 0},  // Or it would be a snapshot of "/v.tmp/a".
           {longest, "%2F" + longest.substr(1), 0},
           {longest + "n", "", ENAMETOOLONG},
           {"", "", EINVAL},
       }) {
    for (const auto& [compose, place] :
         {std::pair{&FILEIDXQueuePathCompose, "queue/"}, std::pair{&FILEIDXDBPathCompose, "db/"}}) {
      const std::string want = kRoot / "var/lib/kavo/fileindex/" + place + name;
      char buffer[4096] = "before";
      EXPECT_EQ(compose(path.c_str(), buffer, want.size()), -1);
      EXPECT_EQ(errno, error == 0 ? ERANGE : error) << path;
      EXPECT_STREQ(buffer, "before");
      EXPECT_EQ(compose(path.c_str(), buffer, want.size() + 1), error == 0 ? 0 : -1);
      EXPECT_EQ(buffer, error == 0 ? want : "before");
    }
  }
  char id[16] = "before";
  EXPECT_EQ(FILEIDXGetIndexID("photos", id, sizeof(id)), -1);
  EXPECT_STREQ(id, "before");
  EXPECT_EQ(FILEIDXGetIndexID("photo", id, sizeof(id)), 0);
  EXPECT_STREQ(id, "fileindex_photo");
  EXPECT_FALSE(std::filesystem::exists(kRoot / "var")) << "nothing is made";
}
