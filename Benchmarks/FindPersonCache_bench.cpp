// How long the find-person cache takes to answer: FindPersonCache_bench RUNS ENTRIES prints, for each run,
// "ENTRIES MICROSECONDS", the time of one question after a person that is known.
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "Platform/runtime/Lifetime.h"
#include "Protocol/Product.h"
#include "VeltoIDAuthenticationDB/FindPersonCache.h"

namespace {

using namespace veltoid;

constexpr size_t kQuestions = 1000;
constexpr size_t kRounds = 100;

String address(size_t number) { return "person" + std::to_string(number) + "@example.com"; }

void fill(size_t entries) {
    for (size_t i = 0; i < entries; ++i) {
        __VeltoIDDBAddFindPersonResultsToCache(Array{Dictionary{
            {"matched", "email"}, {"value", address(i)}, {"FirstName", "Jane"}, {"LastName", "Roe"}}});
    }
}

/// Questions all over the cache, as many for a small one. They are few enough to stay in the processor's
/// caches with what they find, so that the search is compared and not the memory.
std::vector<Dictionary> questions(size_t entries) {
    std::vector<Dictionary> all;
    for (size_t i = 0; i < kQuestions; ++i) all.push_back({{"email", Array{address(i * 7919 % entries)}}});
    return all;
}

double microsecondsEach(const std::vector<Dictionary>& questions) {
    const auto start = std::chrono::steady_clock::now();
    for (size_t round = 0; round < kRounds; ++round) {
        for (const Dictionary& question : questions)
            if (!__VeltoIDDBCopyCachedFindPersonResults(question)) std::_Exit(EXIT_FAILURE);
    }
    const std::chrono::duration<double, std::micro> time = std::chrono::steady_clock::now() - start;
    return time.count() / static_cast<double>(kRounds * questions.size());
}

}  // namespace

int main(int argc, char** argv) {
    const platform::Lifetime lifetime(veltoid::kProduct);
    if (argc != 3) return EXIT_FAILURE;
    const size_t entries = std::strtoul(argv[2], nullptr, 10);
    fill(entries);
    const auto asked = questions(entries);
    for (long runs = std::strtol(argv[1], nullptr, 10); runs > 0; --runs)
        std::printf("%zu %.4f\n", entries, microsecondsEach(asked));
}
