// Reading and writing property lists: a container marker (the small file the
// migrator writes for every container) and a large map, in both forms. The
// XML numbers include the structural check that runs before libplist.
#include <benchmark/benchmark.h>

#include <string>

#include "Platform/Foundation/PropertyList.h"

namespace {

using platform::Dictionary;
using platform::Value;
namespace plist = platform::plist;

Value marker() {
  return Value(Dictionary{{"BundleIdentifier", Value("com.example.app")},
                          {"BundlePath", Value("/private/var/mobile/Applications/0A1B2C3D/Example.app")},
                          {"ContainerPath", Value("/private/var/mobile/Applications/0A1B2C3D")},
                          {"ContainerType", Value("App")}});
}

Value largeMap(int64_t entries) {
  Dictionary map;
  for (int64_t i = 0; i < entries; ++i) {
    map["group.com.example." + std::to_string(i)] =
        Value(Dictionary{{"Container", Value("/private/var/mobile/Containers/Shared/" + std::to_string(i))},
                         {"Size", Value(static_cast<uint64_t>(i) * 4096)}});
  }
  return Value(std::move(map));
}

void parse(benchmark::State& state, const Value& value, plist::Format format) {
  const platform::Data bytes = *plist::serialize(value, format);
  for (auto _ : state) benchmark::DoNotOptimize(plist::parse(bytes.data(), bytes.size()));
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * bytes.size()));
}

void serialize(benchmark::State& state, const Value& value, plist::Format format) {
  for (auto _ : state) benchmark::DoNotOptimize(plist::serialize(value, format));
}

void BM_ParseMarkerXML(benchmark::State& state) { parse(state, marker(), plist::Format::XML); }
void BM_ParseMarkerBinary(benchmark::State& state) { parse(state, marker(), plist::Format::Binary); }
void BM_ParseMapXML(benchmark::State& state) { parse(state, largeMap(state.range(0)), plist::Format::XML); }
void BM_ParseMapBinary(benchmark::State& state) { parse(state, largeMap(state.range(0)), plist::Format::Binary); }
void BM_SerializeMapXML(benchmark::State& state) { serialize(state, largeMap(state.range(0)), plist::Format::XML); }
void BM_SerializeMapBinary(benchmark::State& state) {
  serialize(state, largeMap(state.range(0)), plist::Format::Binary);
}

BENCHMARK(BM_ParseMarkerXML);
BENCHMARK(BM_ParseMarkerBinary);
BENCHMARK(BM_ParseMapXML)->Arg(1000)->Arg(10000);
BENCHMARK(BM_ParseMapBinary)->Arg(1000)->Arg(10000);
BENCHMARK(BM_SerializeMapXML)->Arg(1000)->Arg(10000);
BENCHMARK(BM_SerializeMapBinary)->Arg(1000)->Arg(10000);

}  // namespace

BENCHMARK_MAIN();
