// The web page's server beside the real daemons, over plain sockets and in a browser.
#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <sys/socket.h>

#include <algorithm>
#include <ctime>
#include <vector>

#include "support/stack.h"
#include "support/temp_folder.h"

namespace {

const PrivateRoot kRoot;
constexpr int kFiles = 45;

// A connection to a port of this machine.
RawClient Connect(uint16_t port) {
  const int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  const timeval patience = {60, 0};
  setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof(patience));
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_port = htons(port);
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  EXPECT_EQ(connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof(address)), 0);
  return RawClient(fd);
}

struct Reply {
  int status;
  std::string head;
  Json::Value body;
};

// "fileindex web" on a port that was free.
class Web {
 public:
  Web() : program_("true", FILEINDEX_PROGRAM " web --listen 127.0.0.1:0 2>&1") {
    EXPECT_TRUE(program_.Await("Ctrl-C ends it\n")) << program_.text;
    const std::string mark = "/#token=";
    const size_t at = program_.text.find(mark);
    url_ = program_.text.substr(0, program_.text.find('\n'));
    port_ = static_cast<uint16_t>(std::stoi(program_.text.substr(strlen("http://127.0.0.1:"))));
    token_ = url_.substr(at + mark.size());
  }

  ~Web() {
    if (!has_ended_) {
      EXPECT_EQ(End(SIGINT), 0);
    }
  }
  Web(const Web&) = delete;
  Web& operator=(const Web&) = delete;

  const std::string& Url() const { return url_; }
  uint16_t Port() const { return port_; }
  const std::string& Token() const { return token_; }
  std::string Host() const { return "Host: 127.0.0.1:" + std::to_string(port_) + "\r\n"; }
  std::string Key() const { return "X-Fileindex-Token: " + token_ + "\r\n"; }
  int End(int signal) {
    has_ended_ = true;
    return program_.End(signal);
  }

  // Without a line for "Host" among the headers, the right one is sent.
  Reply Ask(const std::string& line, const std::string& headers) const {
    const RawClient client = Connect(port_);
    client.Send(line + " HTTP/1.1\r\n" +
                (headers.find("Host:") == std::string::npos ? Host() : "") + headers + "\r\n");
    const std::string text = client.Receive();
    const size_t head = text.find("\r\n\r\n");
    Reply reply = {-1, text.substr(0, head), {}};
    if (text.starts_with("HTTP/1.1 ") && head != std::string::npos) {
      reply.status = std::stoi(text.substr(9));
      vexlo::JsonFromString(reply.body, text.substr(head + 4));
    }
    return reply;
  }
  Json::Value Get(const std::string& target) const {
    const Reply reply = Ask("GET " + target, Key());
    EXPECT_EQ(reply.status, 200) << target << vexlo::JsonToString(reply.body);
    return reply.body;
  }

 private:
  Program program_;
  bool has_ended_ = false;
  std::string url_;
  uint16_t port_ = 0;
  std::string token_;
};

class WebTest : public testing::Test {
 protected:
  static void SetUpTestSuite() {
    stack = new Stack(kRoot);
    for (int i = 0; i < kFiles; ++i) {
      WriteText(stack->In() + "/letter" + std::to_string(100 + i) + ".txt", "the harbour");
    }
    std::filesystem::create_directory(stack->In() + "/caf\xE9 & co");
    WriteText(stack->In() + "/caf\xE9 & co/na\xEFve.txt", "a lighthouse");
    WriteText(stack->In() + "/<img src=x onerror=alert(1)>.txt", "lighthouse <b>keeper</b>");
    ASSERT_TRUE(stack->AwaitQuiet());
  }
  static void TearDownTestSuite() { delete std::exchange(stack, nullptr); }

  static Stack* stack;
  Web web_;
};
Stack* WebTest::stack = nullptr;

TEST_F(WebTest, AnswersNobodyButItsOwner) {
  const std::string own = "127.0.0.1:" + std::to_string(web_.Port());
  const std::string key = web_.Key();
  const std::string with_token = "GET /api/status?token=" + web_.Token();
  const struct {
    const char* name;
    std::string line;
    std::string headers;
    int status;
  } cases[] = {
      {"Page", "GET /", "", 200},
      {"PageByIpv6", "GET /", "Host: [::1]:80\r\n", 200},
      {"WayUp", "GET /../../etc/passwd", "", 404},
      {"NoHost", "GET /", "Host:\r\n", 421},
      {"Rebound", "GET /", "Host: evil.example\r\n", 421},
      {"ReboundData", "GET /api/status", key + "Host: evil.example\r\n", 421},
      {"HostBeginsRight", "GET /", "Host: 127.0.0.1.evil.example\r\n", 421},
      {"HostEndsRight", "GET /", "Host: evil.example:127.0.0.1\r\n", 421},
      {"NetworkHost", "GET /", "Host: 192.168.1.1\r\n", 421},
      {"TwoHosts", "GET /", web_.Host() + "Host: evil.example\r\n", 421},
      {"Data", "GET /api/status", key, 200},
      {"DataWithoutToken", "GET /api/status", "", 401},
      {"TokenInAddress", with_token, "", 401},
      {"WrongToken", "GET /api/status", "X-Fileindex-Token: 00\r\n", 401},
      {"EmptyToken", "GET /api/status", "X-Fileindex-Token:\r\n", 401},
      {"LongerToken", "GET /api/status", "X-Fileindex-Token: " + web_.Token() + "0\r\n", 401},
      {"ChangeWithoutToken", "POST /api/pause", "Content-Length: 0\r\n", 401},
      {"OwnOrigin", "GET /api/status", key + "Origin: http://" + own + "\r\n", 200},
      {"OtherOrigin", "POST /api/resume", key + "Origin: http://evil.example\r\n", 403},
      {"OtherPort", "POST /api/resume", key + "Origin: http://127.0.0.1:1\r\n", 403},
      {"NullOrigin", "GET /api/status", key + "Origin: null\r\n", 403},
      {"OwnSite", "GET /api/status", key + "Sec-Fetch-Site: same-origin\r\n", 200},
      {"SameSite", "POST /api/resume", key + "Sec-Fetch-Site: same-site\r\n", 403},
      {"Preflight", "OPTIONS /api/pause", "Origin: http://evil.example\r\n", 403},
      {"GetToChange", "GET /api/pause", key, 405},
      {"Body", "POST /api/pause", key + "Content-Length: 1\r\n", 413},
      {"ChunkedBody", "POST /api/pause", key + "Transfer-Encoding: chunked\r\n", 413},
  };
  for (const auto& test : cases) {
    SCOPED_TRACE(test.name);
    const Reply reply = web_.Ask(test.line, test.headers);
    EXPECT_EQ(reply.status, test.status) << reply.head;
    for (const char* const wanted :
         {"frame-ancestors 'none'", "default-src 'none'", "script-src 'self';", "nosniff",
          "Referrer-Policy: no-referrer", "Cache-Control: no-store"}) {
      EXPECT_NE(reply.head.find(wanted), std::string::npos) << wanted << "\n" << reply.head;
    }
    EXPECT_EQ(reply.head.find("Access-Control"), std::string::npos) << reply.head;
    EXPECT_EQ(reply.head.find(web_.Token()), std::string::npos) << reply.head;
  }
  EXPECT_EQ(web_.Get("/api/status")["resume_time"].asInt(), -1)
      << "a refused request has changed it";
}

TEST_F(WebTest, SaysWhatIsWrongWithArguments) {
  const std::pair<const char*, const char*> cases[] = {
      {"GET /api/search", "wants words"},
      {"GET /api/search?word=a", "no argument 'word'"},
      {"GET /api/search?words=a%00b", "NUL"},
      {"GET /api/search?words=a&limit=101", "'101', is no number"},
      {"GET /api/search?below=letters", "its full path is wanted"},
      {"GET /api/search?larger=big", "'big' is no size"},
      {"GET /api/search?newer=%C3", "'\xC3' is no date"},
      {"POST /api/pause?hours=0", "'0' is no number of hours"},
  };
  for (const auto& [line, message] : cases) {
    const Reply reply = web_.Ask(line, web_.Key());
    EXPECT_EQ(reply.status, 400) << line << reply.head;
    EXPECT_NE(reply.body["error"]["message"].asString().find(message), std::string::npos)
        << line << vexlo::JsonToString(reply.body);
  }
}

TEST_F(WebTest, RefusesRequestsThatAreTooLong) {
  const std::string much(size_t{40} << 10, 'a');
  EXPECT_EQ(web_.Ask("GET /api/search?words=" + much, web_.Key()).status, 414);
  EXPECT_EQ(web_.Ask("GET /", "X-Much: " + much + "\r\n").status, 431);
  EXPECT_EQ(web_.Ask("GET /", "").status, 200);
}

TEST_F(WebTest, ShowsAPageOfWhatIsFound) {
  const Json::Value reply = web_.Get("/api/search?words=harbour&sort=name&limit=20&from=40");
  EXPECT_EQ(reply["total"].asInt(), kFiles);
  EXPECT_EQ(reply["data"].size(), 5U);
  EXPECT_EQ(reply["data"][0]["name"].asString(), "letter140.txt");
  EXPECT_EQ(reply["data"][0]["snippet"].asString(), "the \x02harbour\x03");
}

TEST_F(WebTest, KeepsNamesAsBytes) {
  const std::string folder = stack->In() + "/caf\xE9 & co";
  const std::string below = "&below=" + stack->In() + "/caf%e9%20%26+co";
  const Json::Value found = web_.Get("/api/search?type=document&smaller=1k" + below)["data"];
  ASSERT_EQ(found.size(), 1U);
  EXPECT_EQ(found[0]["path"].asString(), folder + "/na\xEFve.txt");
  EXPECT_TRUE(web_.Get("/api/search?words=lighthouse&larger=1k")["data"].empty());
}

TEST_F(WebTest, PausesAndResumes) {
  const time_t before = time(nullptr);
  const Reply paused = web_.Ask("POST /api/pause?hours=2", web_.Key());
  EXPECT_EQ(paused.status, 200) << paused.head;
  EXPECT_GE(paused.body["resume_time"].asInt64(), before + 7200);
  EXPECT_LE(paused.body["resume_time"].asInt64(), time(nullptr) + 7200);
  WriteText(stack->In() + "/new.txt", "the ferry");
  EXPECT_TRUE(Stack::Await([&] {
    return web_.Get("/api/folders")["folder"][0]["additional"]["status"]["text"] == "paused";
  }));
  EXPECT_FALSE(stack->IsFound("ferry"));

  const Reply resumed = web_.Ask("POST /api/resume", web_.Key() + "Content-Length: 0\r\n");
  EXPECT_EQ(resumed.body["resume_time"].asInt(), -1);
  EXPECT_TRUE(Stack::Await([&] { return stack->IsFound("ferry"); })) << stack->Logs();
}

TEST_F(WebTest, IsThereForOthersWhileClientsStall) {
  const auto begin = Stack::Clock::now();
  std::vector<RawClient> stalled;
  stalled.reserve(200);
  for (int i = 0; i < 200; ++i) {
    stalled.push_back(Connect(web_.Port()));
    stalled.back().Send(i % 2 == 0 ? "" : "GET /api/status HTTP/1.1\r\nX-Slow: ");
  }
  EXPECT_EQ(web_.Get("/api/search?words=harbour")["total"].asInt(), kFiles);
  EXPECT_LT(Stack::Clock::now() - begin, std::chrono::seconds(10));
  EXPECT_EQ(web_.End(SIGINT), 0);
}

TEST_F(WebTest, AnswersWhatItCanWhileTheEngineHangs) {
  const std::string search =
      "GET /api/search?words=harbour HTTP/1.1\r\n" + web_.Host() + web_.Key() + "\r\n";
  stack->Signal("kavoelasticd", SIGSTOP);
  std::vector<RawClient> searches;
  searches.reserve(10);
  for (int i = 0; i < 10; ++i) {  // As many as two threads and the queue for them take.
    searches.push_back(Connect(web_.Port()));
    searches.back().Send(search);
  }
  EXPECT_TRUE(Stack::Await(
      [&] { return web_.Ask("GET /api/search?words=harbour", web_.Key()).status == 503; }));
  EXPECT_EQ(web_.Get("/api/folders")["total"].asInt(), 1);
  for (const Json::Value& daemon : web_.Get("/api/status")["daemons"]) {
    EXPECT_EQ(daemon["running"].asBool(), daemon["name"] != "kavoelasticd")
        << daemon["name"].asString();
  }
  stack->Signal("kavoelasticd", SIGCONT);
  const auto found = std::count_if(searches.begin(), searches.end(), [](const RawClient& client) {
    return client.Receive().find("\"total\":45") != std::string::npos;
  });
  EXPECT_GE(found, 8) << "searches that have waited";

  stack->Signal("kavoelasticd", SIGSTOP);
  const RawClient last = Connect(web_.Port());
  last.Send(search);
  web_.Get("/api/folders");
  const auto begin = Stack::Clock::now();
  EXPECT_EQ(web_.End(SIGINT), 0);
  EXPECT_LT(Stack::Clock::now() - begin, std::chrono::seconds(20));
  stack->Signal("kavoelasticd", SIGCONT);
}

TEST_F(WebTest, ListensOnThisMachineOnly) {
  const std::string taken = "127.0.0.1:" + std::to_string(web_.Port());
  const std::tuple<std::string, int, std::string> cases[] = {
      {"0.0.0.0:0", 2, "can be reached from other machines"},
      {"[::]:0", 2, "ssh -L"},
      {"[::ffff:127.0.0.1]:0", 2, "can be reached"},
      {"example.com:80", 2, "is no address"},
      {"127.0.0.1:65536", 2, "is no address"},
      {taken, 3, "another program listens on " + taken},
  };
  for (const auto& [place, status, message] : cases) {
    Program program("true", FILEINDEX_PROGRAM " web --listen '" + place + "' 2>&1");
    EXPECT_EQ(program.End(), status) << place;
    EXPECT_NE(program.text.find(message), std::string::npos) << program.text;
  }
}

TEST_F(WebTest, WorksInABrowser) {
  if (system("command -v python3 chromium >/dev/null") != 0) {  // NOLINT(concurrency-mt-unsafe)
    GTEST_SKIP() << "without the programs python3 and chromium the page itself is not tested";
  }
  Program script("true",
                 "python3 " WEB_PAGE_SCRIPT " '" + web_.Url() + "' '" + stack->In() + "' 2>&1");
  EXPECT_EQ(script.End(), 0) << script.text;
  EXPECT_EQ(web_.Get("/api/status")["resume_time"].asInt(), -1);
}

}  // namespace
