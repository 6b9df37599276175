// Real file systems for a test program. A program that includes this has a mount namespace of its
// own from before main() on: nobody else sees its mounts, and they go with it.
//
// Root gets a mount namespace alone. Anybody else gets a user namespace around it, in which tmpfs
// and bind mounts work and images do not; the program's own files are then as open to it as to
// root, whatever their mode, though its user id stays what it was.
#ifndef SUPPORT_PRIVATE_MOUNTS_H_
#define SUPPORT_PRIVATE_MOUNTS_H_

#include <gtest/gtest.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <string>
#include <utility>

// Ends the test as skipped when a ScopedMount did not come about.
#define SKIP_IF_REFUSED(mount)     \
  if ((mount).Refusal().empty()) { \
  } else                           \
    GTEST_SKIP() << (mount).Refusal()

// "" when the namespace was entered, otherwise why not.
inline std::string EnterPrivateMounts() {
  const std::string user = std::to_string(geteuid());
  const std::string group = std::to_string(getegid());
  if (unshare(CLONE_NEWNS) != 0) {
    if (unshare(CLONE_NEWUSER | CLONE_NEWNS) != 0) {
      return std::string("no mount namespace: ") + strerror(errno);
    }
    std::ofstream("/proc/self/setgroups") << "deny";
    std::ofstream("/proc/self/uid_map") << user + " " + user + " 1";
    std::ofstream("/proc/self/gid_map") << group + " " + group + " 1";
  }
  return mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0
             ? ""
             : std::string("mounts cannot be made private: ") + strerror(errno);
}

inline const std::string kPrivateMountsRefusal = EnterPrivateMounts();

// Runs shell commands, up to the first that fails. "" when all were well, otherwise their output.
inline std::string RunCommands(const std::string& commands) {
  const std::string all = "{ set -e; PATH=$PATH:/usr/sbin:/sbin; " + commands + "\n} 2>&1";
  FILE* const pipe = popen(all.c_str(), "re");
  std::string output;
  for (int c = 0; pipe != nullptr && (c = fgetc(pipe)) != EOF;) {
    output += static_cast<char>(c);
  }
  return pipe != nullptr && pclose(pipe) == 0 ? "" : commands + ": " + output;
}

// A mount that lasts as long as this object. The folder that it is mounted on is made when missing.
class ScopedMount {
 public:
  // As mount(2).
  ScopedMount(const std::string& source, const std::string& target, const std::string& type,
              unsigned long flags = 0, const std::string& options = "")
      : ScopedMount(target, kPrivateMountsRefusal) {
    if (refusal_.empty() &&
        mount(source.c_str(), target.c_str(), type.c_str(), flags, options.c_str()) != 0) {
      refusal_ = "mount " + type + " on " + target + ": " + strerror(errno);
    }
  }
  ~ScopedMount() {
    if (refusal_.empty()) {
      umount2(target_.c_str(), MNT_DETACH);
    }
  }
  ScopedMount(const ScopedMount&) = delete;
  ScopedMount& operator=(const ScopedMount&) = delete;

  static ScopedMount Tmpfs(const std::string& target, const std::string& options = "",
                           unsigned long flags = 0) {
    return {"tmpfs", target, "tmpfs", flags, options};
  }
  static ScopedMount Bind(const std::string& source, const std::string& target) {
    return {source, target, "", MS_BIND};
  }
  // An image that `commands` make in the file $IMAGE, by a loop device that goes with the mount.
  static ScopedMount Image(const std::string& commands, const std::string& target,
                           const std::string& options) {
    return {target,
            !kPrivateMountsRefusal.empty()
                ? kPrivateMountsRefusal
                : RunCommands("IMAGE=" + target + ".img; " + commands + "; mkdir -p " + target +
                              "; mount -n -o loop," + options + " $IMAGE " + target)};
  }

  // "" when it is mounted, otherwise why not.
  const std::string& Refusal() const { return refusal_; }
  std::string operator/(const std::string& name) const { return target_ + "/" + name; }
  const std::string& Path() const { return target_; }

 private:
  ScopedMount(std::string target, std::string refusal)
      : target_(std::move(target)), refusal_(std::move(refusal)) {
    mkdir(target_.c_str(), 0755);
  }

  std::string target_;
  std::string refusal_;
};

#endif  // SUPPORT_PRIVATE_MOUNTS_H_
