#include "fileindex/util/notification.h"

#include <string>

#include "fileindex/paths.h"
#include "kavo/exec.h"

namespace vexlo::fileindex {
namespace {

constexpr char kApplication[] = "KAVO.Vexlo.Application";
constexpr char kRecipients[] = "@administrators";
constexpr char kTitleKey[] = "app:displayname";

}  // namespace

int SendQPXNotify() {
  // The last two arguments fill the message's placeholders: a link to the application's settings.
  return KLIBCExecl(kNotifyToolPath.Get().c_str(), KLIBC_EXEC_DEFAULT, "-c", kApplication, "-b",
                    "true", "-e", "false", kRecipients, kTitleKey, "error:index_no_space",
                    "<a data-kavo-app=\"KAVO.Vexlo.Application\" data-kavo-fn=\"preference\">",
                    "</a>", nullptr);
}

int NotifyLackOfMemory() {
  return KLIBCExecl(kNotifyToolPath.Get().c_str(), KLIBC_EXEC_DEFAULT, "-c", kApplication,
                    kRecipients, kTitleKey, "error:lack_of_memory", nullptr);
}

}  // namespace vexlo::fileindex
