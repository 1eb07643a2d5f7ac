// A real HTTPS server for tests: Python's, with certificates of an authority made for it.
#pragma once

#include <fcntl.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <stdexcept>
#include <string>

namespace platform {

/// Prints the ports of a server whose certificate names localhost, of one whose certificate does not, of one
/// that an unknown authority vouches for, and of one without TLS. What it does depends on the path.
inline constexpr const char* kServerScript = R"python(
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

inline constexpr const char* kMakeCertificates = R"shell(
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

/// The servers, for as long as the object lives; SSL_CERT_FILE names the authority that is trusted.
class TestHTTPServer {
  public:
    enum Kind { Good, WrongName, Stranger, Plain };

    TestHTTPServer() {
        char pattern[] = "/tmp/https-test-XXXXXX";
        directory_ = mkdtemp(pattern);
        const std::string make = "cd " + directory_ + " && { " + kMakeCertificates + "} >make.log 2>&1";
        if (std::system(make.c_str()) != 0) throw std::runtime_error("cannot make certificates");
        std::ofstream(directory_ + "/server.py") << kServerScript;
        setenv("SSL_CERT_FILE", (directory_ + "/known.crt").c_str(), 1);
        run();
    }

    ~TestHTTPServer() {
        close(input_);
        waitpid(process_, nullptr, 0);
        std::filesystem::remove_all(directory_);
    }
    TestHTTPServer(const TestHTTPServer&) = delete;
    TestHTTPServer& operator=(const TestHTTPServer&) = delete;

    std::string url(const std::string& path, Kind kind = Good, const std::string& scheme = "https") const {
        return scheme + "://localhost:" + std::to_string(ports_.at(kind)) + path;
    }

  private:
    /// By its whole name, from which it finds its library: another one may come first on PATH.
    static constexpr const char* kPython = "/usr/bin/python3";

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
                execl(kPython, kPython, "server.py", "good", "wrong-name", "stranger", nullptr);
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

}  // namespace platform
