// A search engine that answers what it is told to, on the engine's own socket.
#ifndef SUPPORT_FAKE_ENGINE_H_
#define SUPPORT_FAKE_ENGINE_H_

#include <deque>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "support/raw_client.h"

class FakeEngine {
 public:
  explicit FakeEngine(const std::string& path)
      : path_(path),
        listener_(UnixSocket(path, SOCK_STREAM, bind)),
        is_listening_(listen(listener_, 8) == 0),
        thread_([this] { Serve(); }) {
    EXPECT_TRUE(is_listening_) << path;
  }
  ~FakeEngine() {
    shutdown(listener_, SHUT_RDWR);
    thread_.join();
    close(listener_);
    unlink(path_.c_str());
  }
  FakeEngine(const FakeEngine&) = delete;
  FakeEngine& operator=(const FakeEngine&) = delete;

  // The replies to the next requests; "" closes the connection without one. Success after the last.
  void Script(std::deque<std::string> replies) {
    const std::lock_guard<std::mutex> lock(mutex_);
    replies_ = std::move(replies);
  }
  // The texts that came since the last call.
  std::vector<std::string> Take() {
    const std::lock_guard<std::mutex> lock(mutex_);
    return std::exchange(requests_, {});
  }

 private:
  void Serve() {
    for (int fd = -1; (fd = accept(listener_, nullptr, nullptr)) >= 0;) {
      const RawClient client(fd);
      uint64_t length = 0;
      const std::string frame = client.Receive(sizeof(length));
      if (frame.size() == sizeof(length)) {  // Else a caller that could not send.
        memcpy(&length, frame.data(), sizeof(length));
        const std::string reply = ReplyTo(client.Receive(length));
        client.Send(reply.empty() ? "" : Frame(reply));
      }
    }
  }
  std::string ReplyTo(std::string request) {
    const std::lock_guard<std::mutex> lock(mutex_);
    requests_.push_back(std::move(request));
    if (replies_.empty()) {
      return R"({"success": true})";
    }
    std::string reply = std::move(replies_.front());
    replies_.pop_front();
    return reply;
  }

  const std::string path_;
  const int listener_;
  const bool is_listening_;
  std::mutex mutex_;
  std::deque<std::string> replies_;
  std::vector<std::string> requests_;
  std::thread thread_;  // Last: it uses the others.
};

#endif  // SUPPORT_FAKE_ENGINE_H_
