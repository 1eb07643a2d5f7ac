// What tests of stored state need: a state directory of their own, a look into its files, and a second
// process.
#pragma once

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <map>
#include <stdexcept>
#include <string>
#include <string_view>
#include <utility>

#include "Platform/runtime/StateDirectory.h"

namespace platform {

/// While it lives, stateDirectory() is in a new directory, which is removed with everything in it at the end.
class TemporaryStateDirectory {
  public:
    TemporaryStateDirectory() {
        std::string name = (std::filesystem::temp_directory_path() / "veltoid-state-XXXXXX").string();
        if (mkdtemp(name.data()) == nullptr) throw std::runtime_error("no temporary directory");
        base_ = name;
        setenv("XDG_STATE_HOME", name.c_str(), 1);
    }
    ~TemporaryStateDirectory() {
        std::error_code ignored;
        std::filesystem::remove_all(base_, ignored);
        unsetenv("XDG_STATE_HOME");
    }
    TemporaryStateDirectory(const TemporaryStateDirectory&) = delete;
    TemporaryStateDirectory& operator=(const TemporaryStateDirectory&) = delete;

    const std::filesystem::path& base() const { return base_; }

    /// The path of a file of the state directory.
    static std::filesystem::path file(std::string_view name) {
        return std::filesystem::path(stateDirectory()) / name;
    }

    /// Name and content of every file of the state directory.
    static std::map<std::string, std::string> contents() {
        std::map<std::string, std::string> files;
        for (const auto& entry : std::filesystem::directory_iterator(stateDirectory())) {
            if (entry.is_regular_file()) files[entry.path().filename()] = readFile(entry.path());
        }
        return files;
    }

    static std::string readFile(const std::filesystem::path& path) {
        std::ifstream stream(path, std::ios::binary);
        return {std::istreambuf_iterator<char>(stream), {}};
    }

    static void writeFile(const std::filesystem::path& path, std::string_view content) {
        std::ofstream(path, std::ios::binary | std::ios::trunc) << content;
    }

  private:
    std::filesystem::path base_;
};

/// Something in the way of a file of the state directory: while it lives, the file cannot be opened.
class Obstacle {
  public:
    explicit Obstacle(std::string_view name) : file_(TemporaryStateDirectory::file(name)) {
        if (std::filesystem::exists(file_)) std::filesystem::rename(file_, aside());
        std::filesystem::create_directory(file_);
    }
    ~Obstacle() {
        EXPECT_TRUE(std::filesystem::remove(file_));
        if (std::filesystem::exists(aside())) std::filesystem::rename(aside(), file_);
    }
    Obstacle(const Obstacle&) = delete;
    Obstacle& operator=(const Obstacle&) = delete;

    /// Where the file is meanwhile.
    std::filesystem::path aside() const { return file_.parent_path().parent_path() / "aside"; }

  private:
    const std::filesystem::path file_;
};

/// A forked process that runs `work` (returning whether all went well) and ends without any clean-up, so that
/// what it leaves on disk is what a crash would leave. Fork before this process opens the store: an open one
/// does not survive.
class ChildProcess {
  public:
    template <typename Work>
    explicit ChildProcess(Work work) {
        const bool failedBefore = testing::Test::HasFailure();
        process_ = fork();
        if (process_ == 0) _exit(work() && testing::Test::HasFailure() == failedBefore ? 0 : 1);
    }
    ~ChildProcess() {
        if (process_ > 0) (void)succeeded();
    }
    ChildProcess(const ChildProcess&) = delete;
    ChildProcess& operator=(const ChildProcess&) = delete;

    pid_t id() const { return process_; }

    /// Waits for its end.
    bool succeeded() {
        int status = -1;
        const pid_t process = std::exchange(process_, -1);
        return process > 0 && waitpid(process, &status, 0) == process && WIFEXITED(status) &&
               WEXITSTATUS(status) == 0;
    }

  private:
    pid_t process_ = -1;
};

}  // namespace platform
