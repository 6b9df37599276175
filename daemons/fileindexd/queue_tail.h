// The newest lines of a queue, while its worker is busy with what stood in it before.
#ifndef DAEMONS_FILEINDEXD_QUEUE_TAIL_H_
#define DAEMONS_FILEINDEXD_QUEUE_TAIL_H_

#include <sys/types.h>

#include <cstdint>
#include <string>
#include <vector>

namespace vexlo::fileindexd {

// Only looks: the lines stay for whoever takes the queue. For one thread, without the queue's lock.
class QueueTail {
 public:
  explicit QueueTail(std::string path) : path_(std::move(path)) {}

  // Whole lines that were appended since the last call, without their newlines. Of many the last
  // 64 KiB. None where the queue cannot be read.
  std::vector<std::string> Next();

 private:
  const std::string path_;
  ino_t inode_ = 0;
  uint64_t seen_ = 0;  // Bytes of it.
};

}  // namespace vexlo::fileindexd

#endif  // DAEMONS_FILEINDEXD_QUEUE_TAIL_H_
