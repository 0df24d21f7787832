// Deciding and counting: the cost of shouldReportTesselObject() and the memory of its counters.
//
// Objects are made beforehand. Selvin, 64 subsystems with 20 categories each, one labelled string
// in two, log at error level.

#include <benchmark/benchmark.h>

#include <malloc.h>

#include <cstdlib>
#include <memory>
#include <string>
#include <vector>

#include "filter/TesselReporterObjectFilter.h"
#include "platform/Log.h"

namespace tessel {
namespace {

constexpr size_t kSubsystems = 64;
constexpr size_t kCategories = 20;

struct OrdinaryBuild final : BuildVariant {
  bool hasInternalDiagnostics(std::string_view) override { return false; }
};

struct DiscardingLog final : LogSink {
  void write(LogLevel, std::string_view, std::string_view, std::string_view) override {}
};

using Objects = std::vector<std::shared_ptr<const TesselEvent>>;

std::shared_ptr<const TesselEvent> makeEvent(const std::shared_ptr<StringPool>& pool,
                                             const std::string& subsystem,
                                             const std::string& category, bool labelled) {
  TracePointFields fields;
  fields.pool = pool;
  fields.subsystem = pool->intern(subsystem);
  fields.category = pool->intern(category);
  fields.name = pool->intern("Open");
  if (labelled) fields.strings[0] = {pool->intern("period"), pool->intern("week")};
  fields.durationSeconds = 0.25F;
  fields.telemetryEnabled = true;
  return std::make_shared<TesselEvent>(std::move(fields), EmittingProcess{});
}

Objects makeObjects(size_t subsystems, size_t categories) {
  const auto pool = std::make_shared<StringPool>();
  Objects objects;
  objects.reserve(subsystems * categories);
  for (size_t category = 0; category < categories; ++category) {
    for (size_t subsystem = 0; subsystem < subsystems; ++subsystem) {
      objects.push_back(makeEvent(pool, "com.vantor.Subsystem" + std::to_string(subsystem),
                                  "Category" + std::to_string(category), objects.size() % 2 == 0));
    }
  }
  return objects;
}

std::shared_ptr<TesselReporterObjectFilter> makeFilter(BuildVariant& variant) {
  static DiscardingLog log;
  setLogSink(&log, LogLevel::error);
  auto filter = TesselReporterObjectFilter::init(variant);
  filter->setScnFilter(makeDefaultFilterForPlatform(filter->platform()));
  return filter;
}

void decideKnownPairs(benchmark::State& state) {
  OrdinaryBuild variant;
  const auto filter = makeFilter(variant);
  const Objects objects = makeObjects(kSubsystems, kCategories);
  for (const auto& object : objects) filter->shouldReportTesselObject(*object, nullptr);
  for (auto _ : state) {
    for (const auto& object : objects) {
      benchmark::DoNotOptimize(filter->shouldReportTesselObject(*object, nullptr));
    }
  }
  state.SetItemsProcessed(state.iterations() * static_cast<int64_t>(objects.size()));
}
BENCHMARK(decideKnownPairs);

// Every call adds a pair, as many as are given; a fresh filter each time.
void decideNewPairs(benchmark::State& state) {
  OrdinaryBuild variant;
  const Objects objects =
      makeObjects(kSubsystems, static_cast<size_t>(state.range(0)) / kSubsystems);
  size_t bytes = 0;
  for (auto _ : state) {
    state.PauseTiming();
    auto filter = makeFilter(variant);
    const size_t before = mallinfo2().uordblks + mallinfo2().hblkhd;
    state.ResumeTiming();
    for (const auto& object : objects) {
      benchmark::DoNotOptimize(filter->shouldReportTesselObject(*object, nullptr));
    }
    state.PauseTiming();
    bytes = mallinfo2().uordblks + mallinfo2().hblkhd - before;
    filter.reset();
    state.ResumeTiming();
  }
  state.SetItemsProcessed(state.iterations() * static_cast<int64_t>(objects.size()));
  // Every object is a reported event, so each pair stands in three aggregations.
  state.counters["bytes_per_pair"] =
      static_cast<double>(bytes) / static_cast<double>(objects.size());
}
BENCHMARK(decideNewPairs)->Arg(1280)->Arg(4096)->Arg(98368)->Arg(1 << 20)->Iterations(5);

}  // namespace
}  // namespace tessel

BENCHMARK_MAIN();
