#include "common/sdk/credentials.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <map>
#include <optional>
#include <vector>

#include "common/error.h"
#include "kavo/credentials.h"
#include "kavo/last_error.h"
#include "kavo/user.h"
#include "support/faults.h"
#include "support/syslog_capture.h"

using vexlo::sdk::SDKCredentials;

namespace {

// A platform with three users, so that the tests need no rights: ann is an administrator.
std::map<std::string, uid_t> users = {{"root", 0}, {"ann", 1000}, {"bob", 1001}};
uid_t effective = 1001;
int last_error = 0;
std::vector<std::string> calls;

const char* NameOf(uid_t uid) {
  const auto found = std::find_if(users.begin(), users.end(),
                                  [uid](const auto& user) { return user.second == uid; });
  return found == users.end() ? nullptr : found->first.c_str();
}

}  // namespace

INTERPOSED uid_t geteuid() noexcept { return effective; }
INTERPOSED gid_t getegid() noexcept { return effective; }
INTERPOSED int KLIBCErrGet() { return last_error; }
INTERPOSED int KAVOUserGetByUID(uid_t uid, KAVO_USER** user) {
  const char* const name = NameOf(uid);
  *user = name == nullptr ? nullptr : new KAVO_USER{strdup(name), uid, uid};
  return name == nullptr ? -1 : 0;
}
INTERPOSED void KAVOUserFree(KAVO_USER* user) {
  free(user->szName);
  delete user;
}
INTERPOSED int KLIBGroupIsAdminGroupMem(const char* user, int /*flags*/) {
  return users.contains(user) ? static_cast<int>(std::string(user) == "ann") : -1;
}
INTERPOSED bool ResetCredentialsByName(const char* name, bool keep_saved) {
  EXPECT_TRUE(keep_saved);
  calls.emplace_back(name);
  const auto user = users.find(name);
  effective = user == users.end() ? effective : user->second;
  errno = user == users.end() ? EPERM : errno;
  return user != users.end();
}

namespace {

TEST(SDKCredentials, TheObjectEndsAsTheUserItNames) {
  struct Row {
    const char* name;
    const char* start;
    const char* named;   // "" for the default constructor.
    const char* become;  // With AsUser(), "" for none.
    const char* inside;
    const char* after;
    std::vector<std::string> calls;
  };
  for (const Row& row : {
           Row{"FoundUserComesBack", "bob", "", "root", "root", "bob", {"root", "bob"}},
           Row{"AdministratorBecomesRoot", "bob", "", "ann", "root", "bob", {"root", "bob"}},
           Row{"NamedUserStays", "bob", "root", "", "root", "root", {"root", "root"}},
           // The object names ann, though it made the process root.
           Row{"NamedAdministratorEndsAsNamed", "bob", "ann", "", "root", "ann", {"root", "ann"}},
       }) {
    SCOPED_TRACE(row.name);
    effective = users.at(row.start);
    calls.clear();
    {
      std::optional<SDKCredentials> credentials;
      if (*row.named == '\0') {
        credentials.emplace();
      } else {
        credentials.emplace(row.named);
      }
      if (*row.become != '\0') {
        credentials->AsUser(row.become);
      }
      EXPECT_STREQ(NameOf(effective), row.inside);
    }
    EXPECT_STREQ(NameOf(effective), row.after);
    EXPECT_EQ(calls, row.calls);
  }
}

TEST(SDKCredentials, AFailureInTheDestructorIsLogged) {
  effective = 1001;
  SyslogCapture log;
  {
    const SDKCredentials credentials;  // Names bob, who is then no more.
    effective = 0;
    users.erase("bob");
  }
  const std::vector<std::string> lines = log.Take();
  ASSERT_EQ(lines.size(), 1U);
  EXPECT_TRUE(
      lines[0].ends_with("(~SDKCredentials) Failed [!ResetCredentialsByName(username_)], "
                         "reason:  [err: Operation not permitted]"));
  users["bob"] = 1001;
}

TEST(SDKCredentials, AFailureToBecomeAUserIsThrown) {
  SyslogCapture quiet;
  const auto reason_of = [](uid_t current, const char* named) -> std::string {
    effective = current;
    try {
      const auto credentials = *named == '\0' ? SDKCredentials() : SDKCredentials(named);
      return "nothing was thrown";
    } catch (const vexlo::Error& error) {
      EXPECT_EQ(error.GetErrorCode(), vexlo::ERR_CREDENTIALS);
      return error.what();
    }
  };
  EXPECT_EQ(reason_of(1001, "eve"), "");
  // The reason begins at the error number, and ends before what is behind it.
  for (const auto& [number, reason] :
       {std::pair{0, "KAVOUserGetByUID failed, err="}, std::pair{28, "="}, std::pair{29, ""},
        std::pair{30, ""}, std::pair{-1, ""}}) {
    last_error = number;
    EXPECT_EQ(reason_of(4242, ""), reason);
  }
}

}  // namespace
