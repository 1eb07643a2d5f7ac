// The agent's process: opens the log, reads the command line, runs the agent and ends it.
#include <sys/prctl.h>
#include <sys/resource.h>
#include <unistd.h>

#include <csignal>
#include <cstdio>
#include <cstdlib>

#include "Logging/Log.h"
#include "Platform/runtime/SystemLog.h"
#include "VeltoIDAuthd/Agent.h"

namespace veltoid {
namespace {

/// What still blocks when the agent has been told to end is not waited for (seconds).
constexpr unsigned kMaxEnd = 1;

/// Memory of this process holds password hashes: it is never written to a core file, nor open to debuggers.
void keepMemoryPrivate() {
    const rlimit none{0, 0};
    setrlimit(RLIMIT_CORE, &none);
#ifndef VELTOID_SANITIZED
    // Sanitizers look at their own process the way a debugger does.
    prctl(PR_SET_DUMPABLE, 0);
#endif
}

int showUsage(int argc, char* const* argv, const CommandLineError& error) {
    const platform::Lifetime lifetime(kProduct);
    VELTOID_LOG_FROM("main", kError, "Got an unexpected argument; ch = ", error.option,
                     " index=", error.index);
    std::printf("%s : [ --checkpassword ] [ --authentication ]\n", argc > 0 ? argv[0] : "unknown");
    return -1;
}

void limitEnd() {
    std::signal(SIGALRM, [](int) { _exit(EXIT_SUCCESS); });
    alarm(kMaxEnd);
}

}  // namespace
}  // namespace veltoid

int main(int argc, char** argv) {
    using namespace veltoid;
    keepMemoryPrivate();
    platform::SystemLog::shared().open(program_invocation_short_name);

    CommandLineError error;
    const auto line = parseCommandLine(argc, argv, error);
    if (!line) return showUsage(argc, argv, error);
    int status = EXIT_SUCCESS;
    {
        Agent agent({.line = *line});
        status = agent.run();
        limitEnd();
    }
    alarm(0);
    return status;
}
