// Base64 of 1 MB both ways against OpenSSL's.
#include <benchmark/benchmark.h>
#include <openssl/evp.h>

#include <string>
#include <vector>

#include "Values/Base64.h"

namespace {

using namespace veltoid;

constexpr size_t kBytes = 1U << 20U;

const Data& bytes() {
    static const auto* data = new Data(Data::filledBy(kBytes, [](uint8_t* out) {
        uint32_t state = 1;
        for (size_t i = 0; i < kBytes; ++i) {
            state = state * 1'664'525U + 1'013'904'223U;
            out[i] = static_cast<uint8_t>(state >> 24U);
        }
        return kBytes;
    }));
    return *data;
}

void reportBytes(benchmark::State& state) {
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations()) * static_cast<int64_t>(kBytes));
}

void encodeAgents(benchmark::State& state) {
    for (auto _ : state) benchmark::DoNotOptimize(base64Encode(bytes()));
    reportBytes(state);
}
BENCHMARK(encodeAgents);

void encodeXMLRPC(benchmark::State& state) {
    for (auto _ : state) benchmark::DoNotOptimize(xmlrpcBase64Encode(bytes().bytes(), true));
    reportBytes(state);
}
BENCHMARK(encodeXMLRPC);

void encodeOpenSSL(benchmark::State& state) {
    for (auto _ : state) {
        std::vector<unsigned char> text(kBytes / 3 * 4 + 5);
        EVP_EncodeBlock(text.data(), bytes().bytes().data(), static_cast<int>(kBytes));
        benchmark::DoNotOptimize(text.data());
    }
    reportBytes(state);
}
BENCHMARK(encodeOpenSSL);

void decodeAgents(benchmark::State& state) {
    const String text = base64Encode(bytes());
    for (auto _ : state) benchmark::DoNotOptimize(base64Decode(text));
    reportBytes(state);
}
BENCHMARK(decodeAgents);

void decodeXMLRPC(benchmark::State& state) {
    const String text = xmlrpcBase64Encode(bytes().bytes(), true);
    for (auto _ : state) benchmark::DoNotOptimize(xmlrpcBase64Decode(text.view()));
    reportBytes(state);
}
BENCHMARK(decodeXMLRPC);

/// Which takes no line breaks inside the text, so that it has less to do.
void decodeOpenSSL(benchmark::State& state) {
    const String text = xmlrpcBase64Encode(bytes().bytes(), false);
    const platform::Bytes symbols = platform::bytesOf(text.view());
    for (auto _ : state) {
        std::vector<unsigned char> out(symbols.size() / 4 * 3);
        if (EVP_DecodeBlock(out.data(), symbols.data(), static_cast<int>(symbols.size())) < 0)
            state.SkipWithError("not decoded");
        benchmark::DoNotOptimize(out.data());
    }
    reportBytes(state);
}
BENCHMARK(decodeOpenSSL);

}  // namespace

BENCHMARK_MAIN();
