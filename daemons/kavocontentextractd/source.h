// The file that is read.
#ifndef DAEMONS_KAVOCONTENTEXTRACTD_SOURCE_H_
#define DAEMONS_KAVOCONTENTEXTRACTD_SOURCE_H_

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

namespace vexlo::extractd {

class Source {
 public:
  // The descriptor is the caller's and outlives the object; its offset is nobody's to rely on.
  // Throws Fault kUnreadable.
  Source(int fd, std::string name);

  int Fd() const { return fd_; }
  uint64_t Size() const { return size_; }
  const std::string& Name() const { return name_; }  // Without folders.

  // Up to `most` bytes from the offset on; fewer only at the end. Throws Fault kUnreadable.
  std::string Read(size_t most, uint64_t offset = 0) const;

 private:
  int fd_;
  uint64_t size_ = 0;
  std::string name_;
};

// The whole file in memory, mapped: one that is cut off meanwhile ends the process.
class Mapping {
 public:
  // Throws Fault kOversized when the file is longer than `most`, or finds no room.
  Mapping(const Source& source, size_t most);
  ~Mapping();
  Mapping(const Mapping&) = delete;
  Mapping& operator=(const Mapping&) = delete;

  std::string_view Bytes() const { return {static_cast<const char*>(address_), size_}; }

 private:
  void* address_ = nullptr;
  size_t size_ = 0;
};

}  // namespace vexlo::extractd

#endif  // DAEMONS_KAVOCONTENTEXTRACTD_SOURCE_H_
