// Cost of adding ranges to a range list. The list is a singly linked list
// that remembers where the last range went: ranges in ascending order (as
// sub-ranges and whole lists come) each start looking there and cost a
// constant; a range before that point walks from the head, which is cheap
// at the head (descending) and costs the list's length at random places.
// Merging ranges keep the list short.

#include "model/HTMemoryRegion.h"
#include "model/HTRangeList.h"

#include <benchmark/benchmark.h>

#include <algorithm>
#include <cstdint>
#include <memory>
#include <numeric>
#include <random>
#include <vector>

namespace {

constexpr uint64_t kPage = 4096;
const HTMemoryTotals kDirtyPage{kPage, 0, 0, 0, 0, 0};

// Reports the time of one insertion beside the time of a whole list.
void countInsertions(benchmark::State& state, int64_t insertions)
{
    state.SetItemsProcessed(state.iterations() * insertions);
    state.counters["per_insert"] = benchmark::Counter(
        static_cast<double>(insertions), benchmark::Counter::kIsIterationInvariantRate | benchmark::Counter::kInvert);
}

// Page-sized ranges one page apart stay separate spans.
void addDisjoint(benchmark::State& state, const std::vector<uint64_t>& pageOrder)
{
    for (auto _ : state) {
        HTRangeList list;
        for (uint64_t index : pageOrder) list.addRange(2 * index * kPage, kPage, kPage, kDirtyPage);
        benchmark::DoNotOptimize(list.head());
    }
    countInsertions(state, static_cast<int64_t>(pageOrder.size()));
}

std::vector<uint64_t> ascending(int64_t count)
{
    std::vector<uint64_t> order(static_cast<size_t>(count));
    std::iota(order.begin(), order.end(), uint64_t{0});
    return order;
}

void BM_AddAscendingDisjoint(benchmark::State& state) { addDisjoint(state, ascending(state.range(0))); }

void BM_AddDescendingDisjoint(benchmark::State& state)
{
    std::vector<uint64_t> order = ascending(state.range(0));
    std::reverse(order.begin(), order.end());
    addDisjoint(state, order);
}

// Spans in random order: the nodes lie scattered in memory relative to list
// order, so each step of the walk is likely a cache miss. Not run at 100k,
// where one pass takes close to a minute.
void BM_AddShuffledDisjoint(benchmark::State& state)
{
    std::vector<uint64_t> order = ascending(state.range(0));
    std::shuffle(order.begin(), order.end(), std::mt19937_64(42));
    addDisjoint(state, order);
}

// Two-page ranges each overlapping the previous one by a page: every
// insertion merges into the single span at the tail.
void BM_AddOverlappingMerging(benchmark::State& state)
{
    const int64_t count = state.range(0);
    for (auto _ : state) {
        HTRangeList list;
        for (int64_t i = 0; i < count; ++i)
            list.addRange(static_cast<uint64_t>(i) * kPage, 2 * kPage, kPage, kDirtyPage);
        benchmark::DoNotOptimize(list.head());
    }
    countInsertions(state, count);
}

// A region whose sub-ranges are `count` one-page runs, alternately dirty
// and clean, touching or `gap` pages apart. Runs of different kinds stay
// separate spans either way.
std::shared_ptr<HTMemoryRegion> alternatingRuns(int64_t count, int64_t gap)
{
    auto region = std::make_shared<HTMemoryRegion>();
    const uint64_t stride = static_cast<uint64_t>(1 + gap) * kPage;
    region->setSize(static_cast<uint64_t>(count) * stride);
    for (int64_t i = 0; i < count; ++i) {
        HTMemoryTotals totals;
        (i % 2 ? totals.clean : totals.dirty) = kPage;
        region->addSubrange(static_cast<uint64_t>(i) * stride, kPage, totals, kPage);
    }
    return region;
}

// Several processes forked from one parent report the same runs of the
// memory they share: the second region's sub-ranges land on spans that hold
// the same runs already. Only that second addition is timed.
void BM_AddSharedRunsAgain(benchmark::State& state)
{
    const int64_t count = state.range(0);
    std::shared_ptr<HTMemoryRegion> region = alternatingRuns(count, state.range(1));
    for (auto _ : state) {
        state.PauseTiming();
        auto list = std::make_unique<HTRangeList>();
        list->addRegion(*region, kPage);
        state.ResumeTiming();
        list->addRegion(*region, kPage);
        benchmark::DoNotOptimize(list->head());
        state.PauseTiming();
        list.reset();
        state.ResumeTiming();
    }
    countInsertions(state, count);
}

}  // namespace

BENCHMARK(BM_AddAscendingDisjoint)->Arg(1000)->Arg(10000)->Arg(100000)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_AddDescendingDisjoint)->Arg(1000)->Arg(10000)->Arg(100000)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_AddShuffledDisjoint)->Arg(1000)->Arg(10000)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_AddOverlappingMerging)->Arg(1000)->Arg(10000)->Arg(100000)->Unit(benchmark::kMillisecond);
// Arguments: runs, pages between runs.
BENCHMARK(BM_AddSharedRunsAgain)
    ->ArgsProduct({{1000, 10000, 100000}, {0, 1}})
    ->ArgNames({"runs", "gap"})
    ->Unit(benchmark::kMillisecond);
