#include "common/sdk/share.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <functional>
#include <map>
#include <optional>

#include "common/error.h"
#include "kavo/last_error.h"
#include "kavo/quota.h"
#include "kavo/share.h"
#include "support/faults.h"
#include "support/private_root.h"
#include "support/syslog_capture.h"

using vexlo::Error;
using vexlo::sdk::SDKShare;

namespace {

const PrivateRoot kRoot;
std::vector<std::string> calls;
std::map<std::string, int> answers;  // What a question answers instead of the platform's own.
int last_error = KAVO_ERR_NONE;

int Ask(const char* name, int (*real)(const KAVO_SHARE*, int*), const KAVO_SHARE* share,
        int* value) {
  calls.emplace_back(name);
  if (ScopedFault::Fires(name)) {
    return -1;
  }
  if (const auto answer = answers.find(name); answer != answers.end()) {
    *value = answer->second;
    return 0;
  }
  return real(share, value);
}

}  // namespace

// Enum() leaves its list to the platform; LeakSanitizer asks here.
// NOLINTNEXTLINE(bugprone-reserved-identifier,readability-identifier-naming)
INTERPOSED const char* __lsan_default_suppressions() { return "leak:SDKShare::Enum"; }

#define QUESTION(name)                                                                    \
  INTERPOSED int name(const KAVO_SHARE* share, int* value) {                              \
    return Ask(#name, REAL_FUNCTION(int, name, (const KAVO_SHARE*, int*)), share, value); \
  }

QUESTION(KLIBShareIsEncryptedGet)
QUESTION(KLIBShareIsReadOnlyGet)
QUESTION(KLIBShareIsEncryptionGet)
QUESTION(KLIBShareRecycleStatusGet)
QUESTION(KLIBShareHideUnreadableGet)
FAULTABLE(int, FILEIDXQueuePathCompose, (const char* path, char* buffer, size_t bytes),
          (path, buffer, bytes))
FAULTABLE(int, FILEIDXDBPathCompose, (const char* path, char* buffer, size_t bytes),
          (path, buffer, bytes))
FAULTABLE(int, FILEIDXGetIndexID, (const char* name, char* buffer, size_t bytes),
          (name, buffer, bytes))
FAULTABLE(int, KLIBShareEnum, (KLIBCSZLIST * *list, const KLIB_SHARE_ENUM* which), (list, which))
INTERPOSED KLIBCSZLIST* KLIBCSzListAlloc(int bytes) {
  EXPECT_EQ(bytes, 1024);
  static const auto real = REAL_FUNCTION(KLIBCSZLIST*, KLIBCSzListAlloc, (int));
  return ScopedFault::Fires("KLIBCSzListAlloc") ? nullptr : real(bytes);
}
INTERPOSED int KAVOShareUserPrivCalc(const char* user, const KAVO_SHARE* share) {
  calls.push_back(std::string(user) + "@" + share->szName);
  return -7;
}
INTERPOSED int KAVOQuotaIsEnough(uid_t user, const char* path, uint64_t bytes) {
  EXPECT_EQ(std::to_string(user) + path + std::to_string(bytes), "0/volume1/photo104857600");
  return last_error == KAVO_ERR_NONE ? 1 : 0;
}
INTERPOSED int KLIBCErrGet() { return last_error; }

namespace {

class Share : public testing::Test {
 protected:
  void SetUp() override {
    calls.clear();
    answers.clear();
    kRoot.SetShares(R"({"name": "photo", "path": "/volume1/photo", "ftp_privilege": 4000000000},
                      {"name": "music", "path": "/volume2/music", "encrypted": true})");
  }
};

struct Failure {
  const char* platform;
  std::function<void(const SDKShare&)> ask;
  int code;
  const char* reason;
  const char* logged;  // "(function) Failed [condition]"
};

const Failure kFailures[] = {
    {"KLIBShareIsEncryptedGet", [](const SDKShare& share) { share.CanBeIndexed(); }, 502,
     "KLIBShareis_encryptedGet failed, share=photo",
     "(CanBeIndexed) Failed [0 > KLIBShareIsEncryptedGet(share_info_, &is_encrypted)]"},
    {"KLIBShareIsReadOnlyGet", [](const SDKShare& share) { share.CanBeIndexed(); }, 502,
     "KLIBShareis_readonlyGet failed, share=photo",
     "(CanBeIndexed) Failed [0 > KLIBShareIsReadOnlyGet(share_info_, &is_readonly)]"},
    {"KLIBShareIsEncryptionGet", [](const SDKShare& share) { share.IsEncryption(); }, 502,
     "KLIBShareIsEncryptionGet failed, share=photo",
     "(IsEncryption) Failed [0 > KLIBShareIsEncryptionGet(share_info_, &is_encryption)]"},
    {"KLIBShareRecycleStatusGet", [](const SDKShare& share) { share.IsEnableRecycleBin(); }, 502,
     "KLIBShareRecycleStatusGet failed, share=photo",
     "(IsEnableRecycleBin) Failed [0 > KLIBShareRecycleStatusGet(share_info_, &is_enabled)]"},
    {"FILEIDXQueuePathCompose", [](const SDKShare& share) { share.GetQueuePath(); }, 502,
     "FILEIDXQueuePathCompose failed, share=photo",
     "(GetQueuePath) Failed [0 > FILEIDXQueuePathCompose(share_info_->szPath, path, "
     "sizeof(path))]"},
    {"FILEIDXDBPathCompose", [](const SDKShare& share) { share.GetDBPath(); }, 502,
     "FILEIDXDBPathCompose failed, share=photo",
     "(GetDBPath) Failed [0 > FILEIDXDBPathCompose(share_info_->szPath, path, sizeof(path))]"},
    {"FILEIDXGetIndexID", [](const SDKShare& share) { share.GetDBName(); }, 502,
     "FILEIDXGetIndexID failed, share=photo",
     "(GetDBName) Failed [0 > FILEIDXGetIndexID(share_info_->szName, name, sizeof(name))]"},
    {"KLIBCSzListAlloc", [](const SDKShare& /*share*/) { SDKShare::Enum(); }, 121,
     "KLIBCSzListAlloc failed",
     "(Enum) Failed [nullptr == (share_list = KLIBCSzListAlloc(BUFSIZ))]"},
    {"KLIBShareEnum", [](const SDKShare& /*share*/) { SDKShare::Enum(); }, 121,
     "KLIBShareEnum failed", "(Enum) Failed [0 > KLIBShareEnum(&share_list, &enum_func)]"},
    {"none", [](const SDKShare& /*share*/) { const SDKShare unknown("Photo"); }, 800, "Photo",
     "(SDKShare) Failed [0 > KAVOShareGet(share_name.c_str(), &share_info_) || !share_info_]"},
};

TEST_F(Share, AFailedQuestionIsLoggedAndThrownAndMayBeAskedAgain) {
  answers = {{"KLIBShareIsReadOnlyGet", 0}};
  for (const Failure& row : kFailures) {
    SCOPED_TRACE(row.logged);
    const SDKShare share("photo");
    SyslogCapture log;
    {
      const ScopedFault fault(row.platform, EIO);
      try {
        row.ask(share);
        ADD_FAILURE() << "nothing was thrown";
      } catch (const Error& error) {
        EXPECT_EQ(error.GetErrorCode(), row.code);
        EXPECT_STREQ(error.what(), row.reason);
      }
    }
    const std::vector<std::string> lines = log.Take();
    ASSERT_EQ(lines.size(), 1U);
    EXPECT_TRUE(lines[0].starts_with("<3>share:")) << lines[0];
    EXPECT_NE(lines[0].find(row.logged + std::string(", reason: ") + row.reason), std::string::npos)
        << lines[0];
    if (row.code != 800) {
      EXPECT_NO_THROW(row.ask(share));  // Neither a lock is held nor a failure cached.
    }
  }
}

TEST_F(Share, EachQuestionHasItsOwnYes) {
  const SDKShare share("photo");
  struct Row {
    const char* platform;
    bool (SDKShare::*ask)() const;
    bool at_0, at_1, at_2, at_failure;
  };
  for (const Row& row :
       {Row{"KLIBShareIsEncryptedGet", &SDKShare::IsLocked, false, true, true, false},
        Row{"KLIBShareIsEncryptionGet", &SDKShare::IsEncryption, false, true, false, true},
        Row{"KLIBShareRecycleStatusGet", &SDKShare::IsEnableRecycleBin, false, true, false, true},
        Row{"KLIBShareHideUnreadableGet", &SDKShare::IsHideUnReadable, false, true, false,
            false}}) {
    for (const auto& [value, want] :
         {std::pair{0, row.at_0}, std::pair{1, row.at_1}, std::pair{2, row.at_2}}) {
      answers = {{row.platform, value}};
      EXPECT_EQ((share.*row.ask)(), want) << row.platform << value;
    }
    if (!row.at_failure) {
      SyslogCapture log;
      const ScopedFault fault(row.platform, EIO);
      EXPECT_FALSE((share.*row.ask)()) << row.platform;
      EXPECT_TRUE(log.Take().empty());
    }
  }
  for (const auto& [encrypted, read_only] :
       {std::pair{0, 0}, std::pair{0, 2}, std::pair{-1, 0}, std::pair{1, 1}}) {
    answers = {{"KLIBShareIsEncryptedGet", encrypted}, {"KLIBShareIsReadOnlyGet", read_only}};
    calls.clear();
    EXPECT_EQ(share.CanBeIndexed(), encrypted == 0 && read_only == 0);
    EXPECT_EQ(calls,
              (std::vector<std::string>{"KLIBShareIsEncryptedGet", "KLIBShareIsReadOnlyGet"}));
  }
  for (const auto& [error, want] :
       {std::pair<int, bool>{KAVO_ERR_NONE, true}, std::pair<int, bool>{0x2900, false},
        std::pair<int, bool>{0x2400, false}, std::pair<int, bool>{KAVO_ERR_SYSTEM, true}}) {
    last_error = error;
    EXPECT_EQ(share.IsSpaceEnough(), want) << error;
  }
  last_error = KAVO_ERR_NONE;
}

TEST_F(Share, WhatIsCachedStaysWhenTheShareIsGone) {
  std::optional<SDKShare> share;
  share.emplace("photo");
  const std::string queue = share->GetQueuePath();
  const std::string database = share->GetDBPath();
  EXPECT_EQ(queue, kRoot / "var/lib/kavo/fileindex/queue/%2Fvolume1%2Fphoto");
  EXPECT_EQ(database, kRoot / "var/lib/kavo/fileindex/db/%2Fvolume1%2Fphoto");
  EXPECT_EQ(share->GetDBName(), "fileindex_photo");
  EXPECT_EQ(share->GetFTPPrivilege(), 4000000000U);
  EXPECT_EQ(share->GetPrivilege("ann"), -7);
  kRoot.SetShares("");
  const ScopedFault fault("FILEIDXQueuePathCompose", EIO);
  EXPECT_EQ(share->GetQueuePath(), queue);
  EXPECT_EQ(share->GetPath() + share->GetName(), "/volume1/photophoto");
  EXPECT_EQ(share->GetPrivilege("ann"), -7);
  EXPECT_EQ(share->GetPrivilege("bob"), -7);
  EXPECT_EQ(calls, (std::vector<std::string>{"ann@photo", "bob@photo"}));
  EXPECT_THROW(share->CanBeIndexed(), Error);
  EXPECT_TRUE(SDKShare::Enum().empty());
}

TEST_F(Share, EnumListsEveryShare) {
  EXPECT_EQ(SDKShare::Enum(), (std::set<std::string>{"music", "photo"}));
}

}  // namespace
