// An HTTP server for one listening socket.
#ifndef CLI_WEB_HTTP_SERVER_H_
#define CLI_WEB_HTTP_SERVER_H_

#include <chrono>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

namespace vexlo::cli {

struct HttpRequest {
  std::string method;
  std::string path;                                           // Unescaped, without the query.
  std::vector<std::pair<std::string, std::string>> headers;   // As they came.
  std::map<std::string, std::vector<std::string>> arguments;  // Of the query, unescaped: bytes.
  bool has_body = false;                                      // One is announced; it is not read.

  // The values of a header, whatever the case of its name.
  std::vector<std::string> Header(std::string_view name) const;
};

struct HttpResponse {
  unsigned int status = 200;
  std::string type;
  std::string body;
  std::vector<std::pair<std::string, std::string>> headers = {};
};

// One thread reads requests and writes responses for all connections; what takes time is answered
// by threads of its own. So a client that stalls costs a connection and nobody waits for it:
//
// - There are up to 96 connections, of one request each. When 48 of them wait for their clients,
// the
//   one that waits longest is closed for the next. A request must have come, and its response have
//   been taken, within 20 seconds each; no drop by drop makes that longer.
// - A request line with its headers has up to 32 KiB; a body is announced to the handler, not read.
// - A lane has threads and a queue, both of fixed size. When the queue is full, the answer is 503.
class HttpServer {
 public:
  // What of a program's work is slow for one reason: one lane does not wait for another.
  struct Lane {
    size_t threads;
    size_t queue;
  };
  using Work = std::function<HttpResponse()>;
  // What a request comes to: a response, or work for the lane of that number.
  using Answer = std::variant<HttpResponse, std::pair<size_t, Work>>;
  // Called on the one thread, so it must not wait. Throws nothing; nor does the work.
  using Handler = std::function<Answer(HttpRequest request)>;

  // Takes the listening socket over. Throws Failure when the server cannot start.
  HttpServer(int socket, std::vector<Lane> lanes, Handler handler);
  // Waits for the work under way, without a limit.
  ~HttpServer();
  HttpServer(const HttpServer&) = delete;
  HttpServer& operator=(const HttpServer&) = delete;

  // Closes connections whose time is over; to be called a few times a second.
  void Tend();

  // Takes no more requests and waits for the work under way. False when some of it goes on after
  // that time: then the process can only be ended.
  bool Stop(std::chrono::milliseconds patience);

 private:
  struct State;
  const std::unique_ptr<State> state_;
};

}  // namespace vexlo::cli

#endif  // CLI_WEB_HTTP_SERVER_H_
