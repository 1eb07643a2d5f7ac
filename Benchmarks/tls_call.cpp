// Times calls to the identity server, each over a new TLS connection, under the system's trust store and
// under a file that holds one authority, in turn. Prints one line per run: "system" or "file" and the median
// call in microseconds.
//
//   tls_call URL AUTHORITY RUNS CALLS
//
// The system's store has to know the server's authority too.
#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "Platform/runtime/Lifetime.h"
#include "Protocol/Product.h"
#include "XMLRPC/XMLRPCShim.h"

namespace {

using namespace veltoid;

constexpr const char* kAuthorityVariable = "SSL_CERT_FILE";
constexpr const char* kMethod = "com.velto.dir.idm.web.collaboration.PersonService.authenticate";
constexpr int kUnmeasuredCalls = 2;

struct TrustStore {
    const char* name;
    /// Null: the system's.
    const char* file;
    std::vector<double> times;

    /// Nothing else runs while no call is under way.
    void use() const {
        if (file != nullptr) {
            setenv(kAuthorityVariable, file, 1);
        } else {
            unsetenv(kAuthorityVariable);
        }
    }
};

/// Microseconds. A refused sign-in is an answer like any other; no answer ends the program.
double timeOfCall(const String& url) {
    const Dictionary nobody{{"veltoConnect", "nobody@example.com"}, {"pwdHash", "-"}};
    std::optional<Dictionary> answer;
    std::optional<Error> error;
    const auto start = std::chrono::steady_clock::now();
    const bool answered =
        xmlInvoke(url, kMethod, nobody, &answer, &error) || error->domain == kXMLErrorDomain;
    const auto end = std::chrono::steady_clock::now();
    if (!answered) {
        (void)std::fprintf(stderr, "tls_call: no answer\n");
        std::_Exit(EXIT_FAILURE);
    }
    return std::chrono::duration<double, std::micro>(end - start).count();
}

double median(std::vector<double>& times) {
    const auto middle = times.begin() + static_cast<std::ptrdiff_t>(times.size() / 2);
    std::nth_element(times.begin(), middle, times.end());
    return *middle;
}

}  // namespace

int main(int argc, char** argv) {
    const platform::Lifetime lifetime(veltoid::kProduct);
    if (argc != 5) return EXIT_FAILURE;
    const String url(argv[1]);
    const int runs = std::atoi(argv[3]);
    const int calls = std::atoi(argv[4]);
    TrustStore stores[] = {{"system", nullptr, {}}, {"file", argv[2], {}}};
    for (int run = 0; run < runs; ++run) {
        // Call by call, so that a disturbance meets both.
        for (int call = run == 0 ? -kUnmeasuredCalls : 0; call < calls; ++call) {
            for (TrustStore& store : stores) {
                store.use();
                const double time = timeOfCall(url);
                if (call >= 0) store.times.push_back(time);
            }
        }
        for (TrustStore& store : stores) {
            std::printf("%s %.1f\n", store.name, median(store.times));
            store.times.clear();
        }
    }
    // Threads of the library may still be about: no destructors.
    (void)std::fflush(stdout);
    std::_Exit(EXIT_SUCCESS);
}
