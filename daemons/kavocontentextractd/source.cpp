#include "daemons/kavocontentextractd/source.h"

#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <system_error>
#include <utility>

#include "daemons/kavocontentextractd/fault.h"
#include "kavo/local/content.h"

namespace vexlo::extractd {
namespace {

namespace reason = kavo::local::content_reason;

[[noreturn]] void FailToRead() {
  throw Fault(reason::kUnreadable, std::generic_category().message(errno));
}

}  // namespace

Source::Source(int fd, std::string name) : fd_(fd), name_(std::move(name)) {
  struct stat info {};
  if (fstat(fd, &info) != 0) {
    FailToRead();
  }
  size_ = static_cast<uint64_t>(info.st_size);
}

std::string Source::Read(size_t most, uint64_t offset) const {
  std::string bytes(static_cast<size_t>(std::min<uint64_t>(most, size_ - std::min(offset, size_))),
                    '\0');
  size_t got = 0;
  while (got < bytes.size()) {
    const ssize_t count =
        pread(fd_, bytes.data() + got, bytes.size() - got, static_cast<off_t>(offset + got));
    if (count == 0) {
      break;
    }
    if (count < 0 && errno != EINTR) {
      FailToRead();
    }
    got += count > 0 ? static_cast<size_t>(count) : 0;
  }
  bytes.resize(got);
  return bytes;
}

Mapping::Mapping(const Source& source, size_t most) {
  if (source.Size() > most) {
    throw Fault(reason::kOversized, "the file has over " + std::to_string(most >> 20) + " MiB");
  }
  size_ = static_cast<size_t>(source.Size());
  address_ = mmap(nullptr, std::max<size_t>(size_, 1), PROT_READ, MAP_PRIVATE, source.Fd(), 0);
  if (address_ == MAP_FAILED) {
    throw Fault(reason::kOversized,
                "the file has no room in memory, " + std::generic_category().message(errno));
  }
}

Mapping::~Mapping() { munmap(address_, std::max<size_t>(size_, 1)); }

}  // namespace vexlo::extractd
