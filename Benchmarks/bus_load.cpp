// Sends pings (command 1) to services on the session bus and prints how long they took. Services named
// together are measured in turn, so that whatever else the machine does hits all of them alike. One line per
// run: NAME NUMBER.
//
//   bus_load cold RUNS NAME...                   microseconds from the message that makes the bus start the
//   service to
//                                                the reply; the service is killed between runs
//   bus_load ping RUNS CALLS NAME...             median microseconds of CALLS calls, one after the other
//   bus_load parallel RUNS CLIENTS MILLISECONDS NAME...   answers per second to that many clients
#include <systemd/sd-bus.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <thread>
#include <vector>

#include "Protocol/Names.h"

namespace {

using Moment = std::chrono::steady_clock::time_point;

constexpr const char* kBus = "org.freedesktop.DBus";
constexpr const char* kBusPath = "/org/freedesktop/DBus";
constexpr int kUnmeasuredCalls = 200;

void require(int result, const char* what) {
    if (result >= 0) return;
    (void)std::fprintf(stderr, "bus_load: %s: %s\n", what, std::strerror(-result));
    std::_Exit(EXIT_FAILURE);
}

Moment now() { return std::chrono::steady_clock::now(); }

double microsecondsSince(Moment start) {
    return std::chrono::duration<double, std::micro>(now() - start).count();
}

double median(std::vector<double> numbers) {
    const auto middle = numbers.begin() + static_cast<std::ptrdiff_t>(numbers.size() / 2);
    std::nth_element(numbers.begin(), middle, numbers.end());
    return *middle;
}

void report(const std::string& service, double number) {
    std::printf("%s %.2f\n", service.c_str(), number);
    (void)std::fflush(stdout);
}

/// One connection to the bus.
class Client {
  public:
    Client() { require(sd_bus_open_user(&bus_), "connecting"); }
    ~Client() { sd_bus_flush_close_unref(bus_); }
    Client(const Client&) = delete;
    Client& operator=(const Client&) = delete;

    /// Waits for the answer, which must be a success; the service is started when it is not running.
    void ping(const std::string& service) {
        sd_bus_message* request = nullptr;
        sd_bus_message* reply = nullptr;
        require(sd_bus_message_new_method_call(bus_, &request, service.c_str(), veltoid::kVeltoIDObjectPath,
                                               veltoid::kVeltoIDMessageInterface, "Send"),
                "request");
        require(sd_bus_message_append(request, "a{sv}", 1, "command", "x", int64_t{1}), "request");
        require(sd_bus_call(bus_, request, 0, nullptr, &reply), "call");
        const char* key = nullptr;
        int success = 0;
        require(sd_bus_message_enter_container(reply, 'a', "{sv}"), "reply");
        require(sd_bus_message_read(reply, "{sv}", &key, "b", &success), "reply");
        if (std::strcmp(key, "success") != 0 || success == 0) require(-EBADMSG, "reply");
        sd_bus_message_unref(reply);
        sd_bus_message_unref(request);
    }

    /// Kills the service's process and returns when the bus knows that it is gone.
    void kill(const std::string& service) {
        bool gone = false;
        sd_bus_slot* slot = nullptr;
        const std::string rule =
            "type='signal',sender='org.freedesktop.DBus',member='NameOwnerChanged',arg0='" + service +
            "',arg2=''";
        require(sd_bus_add_match(bus_, &slot, rule.c_str(), noteGone, &gone), "match");
        if (::kill(processOf(service), SIGKILL) < 0) require(-errno, "kill");
        while (!gone) {
            const int result = sd_bus_process(bus_, nullptr);
            require(result, "waiting");
            if (result == 0) require(sd_bus_wait(bus_, UINT64_MAX), "waiting");
        }
        sd_bus_slot_unref(slot);
    }

  private:
    static int noteGone(sd_bus_message* /*message*/, void* gone, sd_bus_error* /*error*/) {
        *static_cast<bool*>(gone) = true;
        return 0;
    }

    pid_t processOf(const std::string& service) {
        sd_bus_message* reply = nullptr;
        uint32_t process = 0;
        require(sd_bus_call_method(bus_, kBus, kBusPath, kBus, "GetConnectionUnixProcessID", nullptr, &reply,
                                   "s", service.c_str()),
                "process");
        require(sd_bus_message_read(reply, "u", &process), "process");
        sd_bus_message_unref(reply);
        return static_cast<pid_t>(process);
    }

    sd_bus* bus_ = nullptr;
};

void measureColdStarts(int runs, const std::vector<std::string>& services) {
    Client client;
    // One start of each is not counted: it reads the files into memory.
    for (int run = -1; run < runs; ++run) {
        for (const std::string& service : services) {
            const Moment start = now();
            client.ping(service);
            if (run >= 0) report(service, microsecondsSince(start));
            client.kill(service);
        }
    }
}

void measurePings(int runs, int calls, const std::vector<std::string>& services) {
    Client client;
    for (int run = 0; run < runs; ++run) {
        for (const std::string& service : services) {
            std::vector<double> times;
            for (int call = -kUnmeasuredCalls; call < calls; ++call) {
                const Moment start = now();
                client.ping(service);
                if (call >= 0) times.push_back(microsecondsSince(start));
            }
            report(service, median(std::move(times)));
        }
    }
}

/// How many answers the clients get together while the period lasts.
long answersDuring(std::chrono::milliseconds period, std::vector<Client>& clients,
                   const std::string& service) {
    std::atomic<long> answers{0};
    std::vector<std::thread> threads;
    threads.reserve(clients.size());
    const Moment end = now() + period;
    for (Client& client : clients) {
        threads.emplace_back([&] {
            while (now() < end) {
                client.ping(service);
                answers.fetch_add(1, std::memory_order_relaxed);
            }
        });
    }
    for (std::thread& thread : threads) thread.join();
    return answers;
}

void measureParallelClients(int runs, size_t count, int milliseconds,
                            const std::vector<std::string>& services) {
    std::vector<Client> clients(count);
    for (const std::string& service : services)
        for (Client& client : clients) client.ping(service);
    for (int run = 0; run < runs; ++run) {
        for (const std::string& service : services) {
            const Moment start = now();
            const long answers = answersDuring(std::chrono::milliseconds(milliseconds), clients, service);
            report(service, static_cast<double>(answers) * 1e6 / microsecondsSince(start));
        }
    }
}

}  // namespace

int main(int argc, char** argv) {
    const std::vector<std::string> words(argv + 1, argv + argc);
    const auto number = [&](size_t index) { return std::atoi(words.at(index).c_str()); };
    const auto services = [&](size_t from) {
        return std::vector(words.begin() + static_cast<std::ptrdiff_t>(from), words.end());
    };
    if (words.size() >= 3 && words[0] == "cold") {
        measureColdStarts(number(1), services(2));
    } else if (words.size() >= 4 && words[0] == "ping") {
        measurePings(number(1), number(2), services(3));
    } else if (words.size() >= 5 && words[0] == "parallel") {
        measureParallelClients(number(1), static_cast<size_t>(number(2)), number(3), services(4));
    } else {
        (void)std::fprintf(stderr,
                           "bus_load: cold, ping or parallel, as described at the head of its source\n");
        return EXIT_FAILURE;
    }
    return EXIT_SUCCESS;
}
