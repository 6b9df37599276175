#include "cli/web/http_server.h"

#include <microhttpd.h>
#include <strings.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <deque>
#include <optional>
#include <thread>

#include "cli/command.h"
#include "kavo/local/mutex.h"

namespace vexlo::cli {
namespace {

using Clock = std::chrono::steady_clock;

constexpr unsigned int kMostConnections = 96;
constexpr size_t kMostWaiting = 48;
constexpr auto kPatience = std::chrono::seconds(20);
constexpr unsigned int kIdleSeconds = 15;
constexpr size_t kRequestBytes = size_t{32} << 10;

HttpResponse Busy() {
  return {MHD_HTTP_SERVICE_UNAVAILABLE,
          "application/json",
          R"({"error":{"message":"too many requests wait for an answer already"}})",
          {}};
}

// The threads of one lane and what waits for them.
class Workers {
 public:
  explicit Workers(const HttpServer::Lane& lane) : most_(lane.queue), running_(lane.threads) {
    threads_.reserve(lane.threads);
    for (size_t i = 0; i < lane.threads; ++i) {
      threads_.emplace_back([this] { Run(); });
    }
  }
  ~Workers() {
    End();
    for (std::thread& thread : threads_) {
      thread.join();
    }
  }
  Workers(const Workers&) = delete;
  Workers& operator=(const Workers&) = delete;

  // False when the queue is full.
  bool Add(std::function<void()> work) {
    const kavo::local::MutexLock lock(mutex_);
    if (ending_ || queue_.size() >= most_) {
      return false;
    }
    queue_.push_back(std::move(work));
    changed_.NotifyAll();
    return true;
  }

  // The threads finish what they have begun.
  void End() {
    const kavo::local::MutexLock lock(mutex_);
    ending_ = true;
    changed_.NotifyAll();
  }
  bool AwaitEnd(Clock::time_point deadline) {
    kavo::local::MutexLock lock(mutex_);
    return changed_.WaitUntil(lock, deadline,
                              [this]() KAVO_REQUIRES(mutex_) { return running_ == 0; });
  }

 private:
  void Run() {
    kavo::local::MutexLock lock(mutex_);
    for (;;) {
      changed_.Wait(lock, [this]() KAVO_REQUIRES(mutex_) { return ending_ || !queue_.empty(); });
      if (ending_) {
        break;
      }
      const std::function<void()> work = std::move(queue_.front());
      queue_.pop_front();
      lock.Unlock();
      work();
      lock.Lock();
    }
    --running_;
    changed_.NotifyAll();
  }

  const size_t most_;
  kavo::local::Mutex mutex_;
  kavo::local::Condition changed_;
  std::deque<std::function<void()>> queue_ KAVO_GUARDED_BY(mutex_);
  bool ending_ KAVO_GUARDED_BY(mutex_) = false;
  size_t running_ KAVO_GUARDED_BY(mutex_);
  std::vector<std::thread> threads_;
};

// Which connections wait for their clients, and since when. A descriptor is in here only while the
// library has it open, so none is shut down that has become another's by then.
class Waiting {
 public:
  void Begin(int socket) {
    const kavo::local::MutexLock lock(mutex_);
    since_[socket] = Clock::now();
    if (since_.size() > kMostWaiting) {
      const auto oldest =
          std::min_element(since_.begin(), since_.end(),
                           [](const auto& a, const auto& b) { return a.second < b.second; });
      ShutDown(oldest);
    }
  }
  void End(int socket) {
    const kavo::local::MutexLock lock(mutex_);
    since_.erase(socket);
  }
  void CloseOverdue() {
    const kavo::local::MutexLock lock(mutex_);
    for (auto at = since_.begin(); at != since_.end();) {
      at = at->second + kPatience < Clock::now() ? ShutDown(at) : std::next(at);
    }
  }

 private:
  using Since = std::map<int, Clock::time_point>;

  // The library sees the end of the connection then, and closes it.
  Since::iterator ShutDown(Since::iterator at) KAVO_REQUIRES(mutex_) {
    shutdown(at->first, SHUT_RDWR);
    return since_.erase(at);
  }

  kavo::local::Mutex mutex_;
  Since since_ KAVO_GUARDED_BY(mutex_);
};

int SocketOf(MHD_Connection* connection) {
  return MHD_get_connection_info(connection, MHD_CONNECTION_INFO_CONNECTION_FD)->connect_fd;
}

MHD_Result TakeValue(void* closure, MHD_ValueKind kind, const char* name, size_t name_size,
                     const char* value, size_t value_size) {
  auto& request = *static_cast<HttpRequest*>(closure);
  std::string name_text(name, name_size);
  std::string value_text = value == nullptr ? "" : std::string(value, value_size);
  if (kind == MHD_HEADER_KIND) {
    request.headers.emplace_back(std::move(name_text), std::move(value_text));
  } else {
    request.arguments[name_text].push_back(std::move(value_text));
  }
  return MHD_YES;
}

HttpRequest ReadRequest(MHD_Connection* connection, const char* path, const char* method) {
  HttpRequest request;
  request.method = method;
  request.path = path;
  MHD_get_connection_values_n(connection, MHD_HEADER_KIND, TakeValue, &request);
  MHD_get_connection_values_n(connection, MHD_GET_ARGUMENT_KIND, TakeValue, &request);
  const std::vector<std::string> lengths = request.Header("Content-Length");
  request.has_body = !request.Header("Transfer-Encoding").empty() ||
                     (!lengths.empty() && lengths != std::vector<std::string>{"0"});
  return request;
}

MHD_Result Respond(MHD_Connection* connection, const HttpResponse& answer) {
  // The library copies the bytes and does not change them.
  MHD_Response* const response = MHD_create_response_from_buffer(
      answer.body.size(), const_cast<char*>(answer.body.data()), MHD_RESPMEM_MUST_COPY);
  if (response == nullptr) {
    return MHD_NO;
  }
  MHD_add_response_header(response, MHD_HTTP_HEADER_CONTENT_TYPE, answer.type.c_str());
  for (const auto& [name, value] : answer.headers) {
    MHD_add_response_header(response, name.c_str(), value.c_str());
  }
  MHD_add_response_header(response, MHD_HTTP_HEADER_CONNECTION, "close");
  const MHD_Result result = MHD_queue_response(connection, answer.status, response);
  MHD_destroy_response(response);
  return result;
}

}  // namespace

std::vector<std::string> HttpRequest::Header(std::string_view name) const {
  std::vector<std::string> values;
  for (const auto& [header, value] : headers) {
    if (header.size() == name.size() && strncasecmp(header.data(), name.data(), name.size()) == 0) {
      values.push_back(value);
    }
  }
  return values;
}

struct HttpServer::State {
  // One request, from its headers to the end of its response.
  struct Exchange {
    std::optional<HttpResponse> response;  // Written before the connection is resumed.
  };

  State(const std::vector<Lane>& wanted_lanes, Handler a_handler) : handler(std::move(a_handler)) {
    for (const Lane& lane : wanted_lanes) {
      lanes.push_back(std::make_unique<Workers>(lane));
    }
  }

  static MHD_Result Handle(void* closure, MHD_Connection* connection, const char* path,
                           const char* method, const char* /*version*/, const char* /*upload*/,
                           size_t* /*upload_size*/, void** exchange) noexcept {
    try {
      return static_cast<State*>(closure)->Go(connection, path, method, exchange);
    } catch (...) {
      return MHD_NO;  // Out of memory; the library closes the connection.
    }
  }
  static void Complete(void* closure, MHD_Connection* connection, void** exchange,
                       MHD_RequestTerminationCode /*why*/) noexcept {
    delete static_cast<Exchange*>(*exchange);
    *exchange = nullptr;
    static_cast<State*>(closure)->waiting.Begin(SocketOf(connection));
  }
  static void Notify(void* closure, MHD_Connection* connection, void** /*context*/,
                     MHD_ConnectionNotificationCode code) noexcept {
    Waiting& waiting = static_cast<State*>(closure)->waiting;
    if (code == MHD_CONNECTION_NOTIFY_STARTED) {
      waiting.Begin(SocketOf(connection));
    } else {
      waiting.End(SocketOf(connection));
    }
  }

  // The library calls it with the headers, and again after the connection was resumed.
  MHD_Result Go(MHD_Connection* connection, const char* path, const char* method, void** state) {
    if (*state != nullptr) {
      const auto& exchange = *static_cast<Exchange*>(*state);
      waiting.Begin(SocketOf(connection));
      return exchange.response ? Respond(connection, *exchange.response) : MHD_NO;
    }
    auto* const exchange = new Exchange;
    *state = exchange;
    Answer answer = handler(ReadRequest(connection, path, method));
    if (auto* const response = std::get_if<HttpResponse>(&answer)) {
      return Respond(connection, *response);
    }
    auto& [lane, work] = std::get<1>(answer);
    waiting.End(SocketOf(connection));
    MHD_suspend_connection(connection);
    const auto run = [this, connection, exchange, work = std::move(work)] {
      exchange->response = work();
      Resume(connection);
    };
    {
      const kavo::local::MutexLock lock(mutex);
      suspended[connection] = exchange;
    }
    if (!lanes[lane]->Add(run)) {
      exchange->response = Busy();
      Resume(connection);
    }
    return MHD_YES;
  }

  void Resume(MHD_Connection* connection) {
    const kavo::local::MutexLock lock(mutex);
    suspended.erase(connection);
    MHD_resume_connection(connection);
  }

  const Handler handler;
  Waiting waiting;
  MHD_Daemon* daemon = nullptr;
  kavo::local::Mutex mutex;
  std::map<MHD_Connection*, Exchange*> suspended KAVO_GUARDED_BY(mutex);
  std::vector<std::unique_ptr<Workers>> lanes;
};

HttpServer::HttpServer(int socket, std::vector<Lane> lanes, Handler handler)
    : state_(std::make_unique<State>(lanes, std::move(handler))) {
  state_->daemon = MHD_start_daemon(
      MHD_USE_EPOLL_INTERNAL_THREAD | MHD_ALLOW_SUSPEND_RESUME, 0, nullptr, nullptr, State::Handle,
      state_.get(), MHD_OPTION_LISTEN_SOCKET, socket, MHD_OPTION_CONNECTION_LIMIT, kMostConnections,
      MHD_OPTION_CONNECTION_MEMORY_LIMIT, kRequestBytes, MHD_OPTION_CONNECTION_TIMEOUT,
      kIdleSeconds, MHD_OPTION_STRICT_FOR_CLIENT, 1, MHD_OPTION_NOTIFY_COMPLETED, State::Complete,
      state_.get(), MHD_OPTION_NOTIFY_CONNECTION, State::Notify, state_.get(), MHD_OPTION_END);
  if (state_->daemon == nullptr) {
    close(socket);
    throw Failure("the web server cannot start");
  }
}

HttpServer::~HttpServer() { Stop(std::chrono::hours(24)); }

void HttpServer::Tend() { state_->waiting.CloseOverdue(); }

bool HttpServer::Stop(std::chrono::milliseconds patience) {
  const auto deadline = Clock::now() + patience;
  for (const auto& lane : state_->lanes) {
    lane->End();
  }
  const bool has_ended = std::all_of(state_->lanes.begin(), state_->lanes.end(),
                                     [&](const auto& lane) { return lane->AwaitEnd(deadline); });
  if (!has_ended || state_->daemon == nullptr) {
    return has_ended;
  }
  // What was still queued. The library wants no connection suspended when it ends.
  std::map<MHD_Connection*, State::Exchange*> left;
  {
    const kavo::local::MutexLock lock(state_->mutex);
    left = state_->suspended;
  }
  for (const auto& [connection, exchange] : left) {
    exchange->response = Busy();
    state_->Resume(connection);
  }
  MHD_stop_daemon(state_->daemon);
  state_->daemon = nullptr;
  return true;
}

}  // namespace vexlo::cli
