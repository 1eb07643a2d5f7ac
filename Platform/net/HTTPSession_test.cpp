// Against a real TLS server: Python's, with certificates of an authority made for the test.
#include "Platform/net/HTTPSession.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <thread>

#include "Platform/runtime/Clock.h"

namespace platform {
namespace {

using namespace std::literals;

/// Prints the ports of a server whose certificate names localhost, of one whose certificate does not, of one
/// that an unknown authority vouches for, and of one without TLS. What it does depends on the path.
constexpr const char* kServerScript = R"python(
import http.server, json, ssl, sys, threading, time

class Handler(http.server.BaseHTTPRequestHandler):
    protocol_version = "HTTP/1.1"

    def log_message(self, *arguments): pass

    def send(self, status, body, length=None, headers={}):
        self.send_response(status)
        self.send_header("Content-Length", str(len(body) if length is None else length))
        for name, value in headers.items(): self.send_header(name, value)
        self.end_headers()
        self.wfile.write(body)

    def do_GET(self):
        body = self.rfile.read(int(self.headers.get("Content-Length", 0)))
        self.close_connection = True
        if self.path == "/echo":
            self.send(200, json.dumps([self.command, self.headers.items(), body.decode()]).encode(),
                      headers={"Set-Cookie": "a=b"})
        elif self.path == "/status": self.send(500, b"<html>oops</html>")
        elif self.path == "/empty": self.send(204, b"")
        elif self.path == "/half": self.send(200, b"<methodResp")
        elif self.path == "/continue":
            self.wfile.write(b"HTTP/1.1 100 Continue\r\n\r\nHTTP/1.1 103 Early Hints\r\n\r\n")
            self.send(200, b"after")
        elif self.path == "/redirect": self.send(302, b"", headers={"Location": "/echo"})
        elif self.path == "/limit": self.send(200, b"x" * (16 << 20))
        elif self.path == "/announced": self.send(200, b"x", length=17 << 20)
        elif self.path == "/unannounced":
            self.wfile.write(b"HTTP/1.0 200 OK\r\n\r\n")
            for _ in range(17): self.wfile.write(b"x" * (1 << 20))
        elif self.path == "/close-inside": self.send(200, b"half", length=8)
        elif self.path == "/silence":
            self.send(200, b"x", length=2)
            self.rfile.read()

    do_POST = do_PUT = do_GET

class Server(http.server.ThreadingHTTPServer):
    request_queue_size = 64

    def __init__(self, certificate):
        super().__init__(("127.0.0.1", 0), Handler)
        if certificate:
            context = ssl.SSLContext(ssl.PROTOCOL_TLS_SERVER)
            context.load_cert_chain(certificate + ".crt", certificate + ".key")
            self.socket = context.wrap_socket(self.socket, server_side=True)
        threading.Thread(target=self.serve_forever, daemon=True).start()

    def handle_error(self, *arguments): pass

servers = [Server(name) for name in sys.argv[1:]] + [Server(None)]
print(*(server.server_port for server in servers), flush=True)
sys.stdin.read()
)python";

constexpr const char* kMakeCertificates = R"shell(
set -e
key() { openssl ecparam -name prime256v1 -genkey -noout -out "$1.key"; }
authority() {
  key "$1"
  openssl req -x509 -new -key "$1.key" -subj "/CN=$1" -days 2 -out "$1.crt"
}
certificate() {
  key "$1"
  openssl req -new -key "$1.key" -subj "/CN=$1" -out "$1.csr"
  printf 'subjectAltName=%s' "$3" > "$1.ext"
  openssl x509 -req -in "$1.csr" -CA "$2.crt" -CAkey "$2.key" -CAcreateserial -days 2 -extfile "$1.ext" -out "$1.crt"
}
authority known
authority unknown
certificate good known DNS:localhost
certificate wrong-name known DNS:elsewhere.example
certificate stranger unknown DNS:localhost
)shell";

/// The server, for as long as the object lives.
class Server {
  public:
    enum Kind { Good, WrongName, Stranger, Plain };

    Server() {
        char pattern[] = "/tmp/https-test-XXXXXX";
        directory_ = mkdtemp(pattern);
        const std::string make = "cd " + directory_ + " && { " + kMakeCertificates + "} >make.log 2>&1";
        if (std::system(make.c_str()) != 0) throw std::runtime_error("cannot make certificates");
        std::ofstream(directory_ + "/server.py") << kServerScript;
        setenv("SSL_CERT_FILE", (directory_ + "/known.crt").c_str(), 1);
        run();
    }

    ~Server() {
        close(input_);
        waitpid(process_, nullptr, 0);
        std::filesystem::remove_all(directory_);
    }
    Server(const Server&) = delete;
    Server& operator=(const Server&) = delete;

    std::string url(const std::string& path, Kind kind = Good, const std::string& scheme = "https") const {
        return scheme + "://localhost:" + std::to_string(ports_.at(kind)) + path;
    }

  private:
    void run() {
        std::array<int, 2> in{};
        std::array<int, 2> out{};
        if (pipe2(in.data(), O_CLOEXEC) != 0 || pipe2(out.data(), O_CLOEXEC) != 0)
            throw std::runtime_error("pipe");
        process_ = fork();
        if (process_ == 0) {
            dup2(in[0], STDIN_FILENO);
            dup2(out[1], STDOUT_FILENO);
            if (chdir(directory_.c_str()) == 0)
                execl("/usr/bin/python3", "python3", "server.py", "good", "wrong-name", "stranger", nullptr);
            _exit(1);
        }
        close(in[0]);
        close(out[1]);
        input_ = in[1];
        FILE* lines = fdopen(out[0], "r");
        for (int& port : ports_)
            if (std::fscanf(lines, "%d", &port) != 1) throw std::runtime_error("the server does not run");
        std::fclose(lines);
    }

    std::string directory_;
    pid_t process_ = 0;
    int input_ = -1;
    std::array<int, 4> ports_{};
};

/// Collects the events of one exchange.
class Outcome : public HTTPSessionEvents {
  public:
    ChallengeAnswer challenge(const ProtectionSpace& space) override {
        challenged.push_back(space.host + " " + space.authenticationMethod +
                             (space.port > 0 ? "" : " no port"));
        return answer;
    }
    void responseHeader(int statusCode) override {
        const std::lock_guard lock(mutex);
        statuses.push_back(statusCode);
        begun.signal();
    }
    void bodyBytes(Bytes bytes) override { body += textOf(bytes); }
    void uploadProgress(uint64_t sent, uint64_t expected) override { progress.emplace_back(sent, expected); }
    void completed(const std::optional<HTTPError>& result) override {
        error = result;
        ++completions;
        queueLabel = WorkQueue::currentLabel() ? *WorkQueue::currentLabel() : "";
        over.signal();
    }

    ChallengeAnswer answer = ChallengeAnswer::PerformDefaultHandling;
    std::mutex mutex;
    std::vector<std::string> challenged;
    std::vector<int> statuses;
    std::string body;
    std::vector<std::pair<uint64_t, uint64_t>> progress;
    std::optional<HTTPError> error;
    std::atomic<int> completions = 0;
    std::string queueLabel;
    std::shared_ptr<HTTPSession> owned;
    Semaphore begun;
    Semaphore over;
};

HTTPRequest requestTo(std::string url) {
    HTTPRequest request;
    request.url = std::move(url);
    request.handlesCookies = false;
    return request;
}

std::shared_ptr<Outcome> exchange(const HTTPRequest& request,
                                  std::optional<WorkQueue> eventQueue = std::nullopt) {
    auto outcome = std::make_shared<Outcome>();
    const auto session = HTTPSession::create(outcome, std::move(eventQueue));
    if (!session) throw std::runtime_error("no HTTPS client");
    session->start(request);
    outcome->over.wait(kForever);
    return outcome;
}

TEST(HTTPSession, SendsExactlyTheRequestAndDeliversTheResponse) {
    const Server server;
    HTTPRequest request = requestTo(server.url("/echo"));
    request.method = "POST";
    request.body = std::string(3000, 'b').c_str();
    request.setHeaderField("content-type", "text/plain");
    request.setHeaderField("Content-Type", "text/xml");
    request.setHeaderField("Content-Length", "1");
    request.setHeaderField("Accept", "text/xml");
    request.setHeaderField("User-Agent", "test");
    request.setHeaderField("X-Empty", "");
    const auto outcome = exchange(request);
    EXPECT_FALSE(outcome->error);
    EXPECT_EQ(outcome->statuses, std::vector{200});
    const std::string host = server.url("", Server::Good).substr(strlen("https://"));
    EXPECT_EQ(outcome->body,
              R"(["POST", [["Host", ")" + host +
                  R"("], ["content-type", "text/xml"], ["Accept", "text/xml"], ["User-Agent", "test"], )"
                  R"(["X-Empty", ""], ["Content-Length", "3000"]], ")" +
                  std::string(3000, 'b') + "\"]");
    EXPECT_EQ(outcome->challenged, std::vector{"localhost ServerTrust"s});
    ASSERT_FALSE(outcome->progress.empty());
    EXPECT_EQ(outcome->progress.back(), std::pair(uint64_t{3000}, uint64_t{3000}));
}

TEST(HTTPSession, KeepsOutcomesApart) {
    struct Case {
        const char* path;
        std::vector<int> statuses;
        std::optional<int> error;
        size_t bodyBytes;
    };
    constexpr int kPartial = 18;
    constexpr int kTooLarge = 63;
    constexpr int kNoAnswer = 52;
    const Case cases[] = {
        {"/status", {500}, std::nullopt, strlen("<html>oops</html>")},
        {"/empty", {204}, std::nullopt, 0},
        {"/half", {200}, std::nullopt, strlen("<methodResp")},
        {"/continue", {200}, std::nullopt, strlen("after")},
        {"/redirect", {302}, std::nullopt, 0},
        {"/limit", {200}, std::nullopt, kMaxHTTPResponseBytes},
        {"/announced", {}, kTooLarge, 0},
        {"/unannounced", {200}, kTooLarge, kMaxHTTPResponseBytes},
        {"/close-inside", {200}, kPartial, 4},
        {"/close-before", {}, kNoAnswer, 0},
    };
    const Server server;
    for (const Case& each : cases) {
        const auto outcome = exchange(requestTo(server.url(each.path)));
        EXPECT_EQ(outcome->statuses, each.statuses) << each.path;
        EXPECT_EQ(outcome->error ? std::optional(outcome->error->code) : std::nullopt, each.error)
            << each.path;
        if (each.error == kTooLarge) {
            EXPECT_LE(outcome->body.size(), each.bodyBytes) << each.path;
        } else {
            EXPECT_EQ(outcome->body.size(), each.bodyBytes) << each.path;
        }
    }
}

TEST(HTTPSession, TalksOnlyToServersThatItCanVerify) {
    struct Case {
        const char* what;
        Server::Kind kind;
        const char* scheme;
        int code;
    };
    constexpr int kBadCertificate = 60;
    constexpr int kNoSuchProtocol = 1;
    constexpr int kNoTLS = 35;
    const Case cases[] = {
        {"a name that the certificate lacks", Server::WrongName, "https", kBadCertificate},
        {"an authority that nobody trusts", Server::Stranger, "https", kBadCertificate},
        {"no TLS behind https", Server::Plain, "https", kNoTLS},
        {"plain http", Server::Plain, "http", kNoSuchProtocol},
        {"a protocol of files", Server::Plain, "ftp", kNoSuchProtocol},
    };
    const Server server;
    for (const Case& each : cases) {
        const auto outcome = exchange(requestTo(server.url("/echo", each.kind, each.scheme)));
        ASSERT_TRUE(outcome->error) << each.what;
        EXPECT_EQ(outcome->error->code, each.code) << each.what;
        EXPECT_FALSE(outcome->error->description.empty()) << each.what;
        EXPECT_TRUE(outcome->body.empty()) << each.what;
    }
    // Without the variable the system's authorities count, and none of those knows this server's.
    unsetenv("SSL_CERT_FILE");
    const auto outcome = exchange(requestTo(server.url("/echo")));
    ASSERT_TRUE(outcome->error);
    EXPECT_EQ(outcome->error->code, kBadCertificate);
}

TEST(HTTPSession, RefusesHeaderFieldsThatWouldEndAndStartAnother) {
    constexpr int kBadArgument = 43;
    const std::pair<const char*, const char*> fields[] = {
        {"X-Field", "a\r\nX-Other: b"}, {"X-Field\nX-Other", "a"}, {"X Field", "a"}, {"", "a"}};
    for (const auto& [name, value] : fields) {
        HTTPRequest request = requestTo("https://localhost:1/");
        request.setHeaderField(name, value);
        const auto outcome = exchange(request);
        ASSERT_TRUE(outcome->error) << name;
        EXPECT_EQ(outcome->error->code, kBadArgument) << name;
    }
}

TEST(HTTPSession, AChallengeThatIsTurnedDownEndsTheExchange) {
    const Server server;
    auto outcome = std::make_shared<Outcome>();
    outcome->answer = ChallengeAnswer::Cancel;
    const auto session = HTTPSession::create(outcome);
    session->start(requestTo(server.url("/echo")));
    outcome->over.wait(kForever);
    EXPECT_TRUE(outcome->error);
    EXPECT_TRUE(outcome->statuses.empty());
}

TEST(HTTPSession, DeliversOnTheEventQueueInOrder) {
    const Server server;
    const auto outcome = exchange(requestTo(server.url("/limit")), WorkQueue("events"));
    EXPECT_EQ(outcome->queueLabel, "events");
    EXPECT_EQ(outcome->statuses, std::vector{200});
    EXPECT_EQ(outcome->body.size(), kMaxHTTPResponseBytes);
}

/// Waits until nobody holds the session any more: its exchange has ended and can report nothing further.
void waitUntilOver(std::shared_ptr<HTTPSession>& session) {
    const std::weak_ptr<HTTPSession> observed = session;
    session.reset();
    while (!observed.expired()) std::this_thread::yield();
}

TEST(HTTPSession, ACancelledExchangeEndsAtOnceAndInSilence) {
    constexpr auto kMuchLessThanAnExchangeMayTake = 20s;
    const Server server;
    const auto outcome = std::make_shared<Outcome>();
    auto session = HTTPSession::create(outcome);
    session->start(requestTo(server.url("/silence")));
    outcome->begun.wait(kForever);
    const auto before = std::chrono::steady_clock::now();
    session->invalidateAndCancel();
    session->start(requestTo(server.url("/half")));
    waitUntilOver(session);
    EXPECT_LT(std::chrono::steady_clock::now() - before, kMuchLessThanAnExchangeMayTake);
    EXPECT_EQ(outcome->completions, 0);
    EXPECT_EQ(outcome->statuses, std::vector{200});
}

}  // namespace
}  // namespace platform
