// How long property lists take to be read: PropertyList_bench RUNS FILE... prints, for each run and each file
// in turn, "FILE:events MICROSECONDS" for the bare reading, which ends in a sink that only counts, and
// "FILE:values MICROSECONDS" for reading and building a value of it.
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <iterator>
#include <string>
#include <utility>
#include <vector>

#include "Platform/propertylist/PropertyList.h"
#include "Values/ValueStream.h"

namespace {

/// Looks at every text and number, so that none of the reading is for nothing.
class Counter final : public platform::ValueSink {
  public:
    void null() override { ++seen_; }
    void boolean(bool value) override { seen_ += value ? 1 : 0; }
    void integer(int64_t value) override { seen_ += static_cast<uint64_t>(value); }
    void unsignedInteger(uint64_t value) override { seen_ += value; }
    void real(double value) override { seen_ += value > 0 ? 1 : 0; }
    void string(std::string_view utf8) override { seen_ += utf8.size(); }
    void data(platform::Bytes bytes) override { seen_ += bytes.size(); }
    void date(double seconds) override { seen_ += seconds > 0 ? 1 : 0; }
    void uuid(std::span<const uint8_t, 16> bytes) override { seen_ += bytes[0]; }
    void fileDescriptor(int) override {}
    void beginArray() override { ++seen_; }
    void endArray() override {}
    void beginDictionary() override { ++seen_; }
    void key(std::string_view utf8) override { seen_ += utf8.size(); }
    void endDictionary() override {}

    bool hasValue() const { return seen_ > 0; }

  private:
    uint64_t seen_ = 0;
};

class Builder final : public veltoid::ValueBuilder {
  public:
    bool hasValue() const { return !value().isAbsent(); }
};

std::string contentsOf(const char* path) {
    std::ifstream stream(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(stream), {}};
}

template <typename Sink>
double readMicroseconds(const std::string& list) {
    Sink sink;
    const auto start = std::chrono::steady_clock::now();
    const bool isRead = platform::readPropertyList(platform::bytesOf(list), sink);
    const auto end = std::chrono::steady_clock::now();
    if (!isRead || !sink.hasValue()) std::exit(EXIT_FAILURE);
    return std::chrono::duration<double, std::micro>(end - start).count();
}

}  // namespace

int main(int argc, char** argv) {
    if (argc < 3) return EXIT_FAILURE;
    std::vector<std::pair<const char*, std::string>> lists;
    for (int i = 2; i < argc; ++i) lists.emplace_back(argv[i], contentsOf(argv[i]));
    for (long runs = std::strtol(argv[1], nullptr, 10); runs > 0; --runs) {
        for (const auto& [path, list] : lists) {
            std::printf("%s:events %.3f\n", path, readMicroseconds<Counter>(list));
            std::printf("%s:values %.3f\n", path, readMicroseconds<Builder>(list));
        }
    }
}
