#include "common/sdk/share.h"

#include <gtest/gtest.h>

#include <functional>
#include <map>
#include <optional>
#include <vector>

#include "common/error.h"
#include "kavo/index_path.h"
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
int last_error = KAVO_ERR_NONE;

}  // namespace

// Enum() leaves its list to the platform; LeakSanitizer asks here.
// NOLINTNEXTLINE(bugprone-reserved-identifier,readability-identifier-naming)
INTERPOSED const char* __lsan_default_suppressions() { return "leak:SDKShare::Enum"; }

FAULTABLE(int, FILEIDXQueuePathCompose, (const char* path, char* buffer, size_t bytes),
          (path, buffer, bytes))
INTERPOSED int KAVOShareUserPrivCalc(const char* user, const KAVO_SHARE* share) {
  calls.push_back(std::string(user) + "@" + share->szName);
  return -7;
}
INTERPOSED int KAVOQuotaIsEnough(uid_t user, const char* path, uint64_t bytes) {
  EXPECT_EQ(std::to_string(user) + path + std::to_string(bytes),
            "0" + kRoot / "v/plain" + "104857600");
  return last_error == KAVO_ERR_NONE ? 1 : 0;
}
INTERPOSED int KLIBCErrGet() { return last_error; }

namespace {

// A share for each setting, with nothing else set.
class Share : public testing::Test {
 protected:
  void SetUp() override {
    std::string shares = R"({"name": "plain", "path": ")" + kRoot.MakeFolder("v/plain") +
                         R"(", "ftp_privilege": 4000000000})";
    for (const std::string setting :
         {"encrypted", "read_only", "encryption", "recycle", "hide_unreadable"}) {
      shares.append(R"(,{"name": ")").append(setting).append(R"(", "path": ")");
      shares.append(kRoot.MakeFolder("v/" + setting)).append(R"(", ")");
      shares.append(setting).append(R"(": true})");
    }
    kRoot.SetShares(shares);
  }
};

TEST_F(Share, EachQuestionHasItsOwnYes) {
  const std::map<std::string, std::string> want = {
      {"plain", "00001"},   {"encrypted", "10000"},  {"read_only", "00000"},
      {"recycle", "00101"}, {"encryption", "01001"}, {"hide_unreadable", "00011"},
  };
  for (const auto& [name, answers] : want) {
    const SDKShare share(name);
    std::string got;
    for (const bool answer : {share.IsLocked(), share.IsEncryption(), share.IsEnableRecycleBin(),
                              share.IsHideUnReadable(), share.CanBeIndexed()}) {
      got += answer ? "1" : "0";
    }
    EXPECT_EQ(got, answers) << name;
  }
  for (const auto& [error, is_enough] : {std::pair<int, bool>{KAVO_ERR_NONE, true},
                                         {KAVO_ERR_QUOTA, false},
                                         {KAVO_ERR_NO_SPACE, false},
                                         {KAVO_ERR_SYSTEM, true}}) {
    last_error = error;
    EXPECT_EQ(SDKShare("plain").IsSpaceEnough(), is_enough) << error;
  }
  last_error = KAVO_ERR_NONE;
}

TEST_F(Share, AFailedQuestionIsThrownAndMayBeAskedAgain) {
  struct Failure {
    std::function<void(const SDKShare&)> ask;
    int code;
    const char* reason;
  };
  const SDKShare share("plain");
  for (const Failure& row : {
           Failure{[](const SDKShare& asked) { asked.CanBeIndexed(); }, 502,
                   "KLIBShareis_encryptedGet failed, share=plain"},
           Failure{[](const SDKShare& asked) { asked.IsEncryption(); }, 502,
                   "KLIBShareIsEncryptionGet failed, share=plain"},
           Failure{[](const SDKShare& asked) { asked.GetQueuePath(); }, 502,
                   "FILEIDXQueuePathCompose failed, share=plain"},
           Failure{[](const SDKShare&) { SDKShare::Enum(); }, 121, "KLIBShareEnum failed"},
           Failure{[](const SDKShare&) { const SDKShare again("plain"); }, 800, "plain"},
       }) {
    SCOPED_TRACE(row.reason);
    WriteText(kRoot / "etc/kavo/shares.json", "{}");
    {
      const SyslogCapture quiet;
      const ScopedFault fault("FILEIDXQueuePathCompose", EIO);
      try {
        row.ask(share);
        ADD_FAILURE() << "nothing was thrown";
      } catch (const Error& error) {
        EXPECT_EQ(error.GetErrorCode(), row.code);
        EXPECT_STREQ(error.what(), row.reason);
      }
      EXPECT_FALSE(share.IsLocked() || share.IsHideUnReadable());
    }
    SetUp();
    EXPECT_NO_THROW(row.ask(share));  // Neither a lock is held nor a failure cached.
  }
}

TEST_F(Share, ANameIsTakenWhole) {
  const SyslogCapture quiet;
  EXPECT_THROW(SDKShare(std::string("plain\0x", 7)), Error);
}

TEST_F(Share, WhatIsCachedStaysWhenTheShareIsGone) {
  EXPECT_EQ(SDKShare::Enum().size(), 6U);
  const SDKShare share("plain");
  const std::string queue = share.GetQueuePath();
  EXPECT_TRUE(queue.starts_with(kRoot / "var/lib/kavo/fileindex/queue/%2F") &&
              queue.ends_with("%2Fv%2Fplain"))
      << queue;
  EXPECT_TRUE(share.GetDBPath().starts_with(kRoot / "var/lib/kavo/fileindex/db/%2F"));
  EXPECT_EQ(share.GetDBName(), "fileindex_plain");
  EXPECT_EQ(share.GetFTPPrivilege(), 4000000000U);
  EXPECT_EQ(share.GetPrivilege("ann"), -7);
  kRoot.SetShares("");
  const ScopedFault fault("FILEIDXQueuePathCompose", EIO);
  EXPECT_EQ(share.GetQueuePath(), queue);
  EXPECT_EQ(share.GetPath() + share.GetName(), kRoot / "v/plain" + "plain");
  EXPECT_EQ(share.GetPrivilege("ann"), -7);
  EXPECT_EQ(share.GetPrivilege("bob"), -7);
  EXPECT_EQ(calls, (std::vector<std::string>{"ann@plain", "bob@plain"}));
  EXPECT_THROW(share.CanBeIndexed(), Error);
  EXPECT_TRUE(SDKShare::Enum().empty());
}

}  // namespace
