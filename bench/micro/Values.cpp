#include <benchmark/benchmark.h>

#include <memory>
#include <string>

#include "bench/InfoPlist.h"
#include "platform/plist/PropertyList.h"
#include "platform/values/Cbor.h"

namespace {

const std::string& infoXml() {
    static const std::string xml = bench::plugInInfo(1, "org.example.point", "");
    return xml;
}

platform::Value info() {
    return *platform::parsePropertyList(infoXml());
}

std::shared_ptr<const std::string> infoCbor() {
    std::string bytes;
    platform::encodeCbor(info(), bytes);
    return std::make_shared<const std::string>(std::move(bytes));
}

void parseInfo(benchmark::State& state) {
    for (auto _ : state) benchmark::DoNotOptimize(platform::parsePropertyList(infoXml()));
}
BENCHMARK(parseInfo);

void encodeInfo(benchmark::State& state) {
    const platform::Value value = info();
    std::string bytes;
    for (auto _ : state) {
        bytes.clear();
        platform::encodeCbor(value, bytes);
        benchmark::DoNotOptimize(bytes.data());
    }
}
BENCHMARK(encodeInfo);

/// What a dictionary costs that is sent again.
void encodeKeptInfo(benchmark::State& state) {
    const platform::Value value = info();
    platform::keepCborEncoded(*value.dictionary());
    std::string bytes;
    for (auto _ : state) {
        bytes.clear();
        platform::encodeCbor(value, bytes);
        benchmark::DoNotOptimize(bytes.data());
    }
}
BENCHMARK(encodeKeptInfo);

void decodeInfo(benchmark::State& state) {
    const auto bytes = infoCbor();
    for (auto _ : state) benchmark::DoNotOptimize(platform::decodeCbor(bytes));
}
BENCHMARK(decodeInfo);

}  // namespace
