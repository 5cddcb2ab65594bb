// The built heft measuring live child processes whose memory the test lays
// out itself: written, swapped, lazily freed and locked anonymous memory, a
// segment shared by two processes, a shared file mapping and the C library's
// image, checked in the JSON document and in the text report against the
// layout and against the kernel's own figures for the same process.

#include "e2e/HTE2EReport.h"
#include "e2e/HTE2ESupport.h"

#include <sys/mman.h>
#include <sys/resource.h>

#include <rapidjson/document.h>

#include <algorithm>
#include <cstdio>
#include <set>
#include <sstream>

namespace {

using namespace heft_e2e;

constexpr const char* kUntagged = "untagged (\"VM_ALLOCATE\")";

std::vector<std::string> categoryNames(const rapidjson::Value& owner)
{
    std::vector<std::string> names;
    const rapidjson::Value* categories = member(owner, "categories");
    if (categories && categories->IsObject()) {
        for (const auto& entry : categories->GetObject()) names.emplace_back(entry.name.GetString());
    }
    return names;
}

std::string describe(const std::vector<std::string>& names)
{
    std::string text;
    for (const auto& name : names) text += "\n  " + name;
    return text;
}

// The region of `process` (listed with -v) that holds `address`.
const rapidjson::Value* regionContaining(const rapidjson::Value& process, uint64_t address)
{
    const rapidjson::Value* regions = member(process, "regions");
    if (!regions || !regions->IsArray()) return nullptr;
    for (const auto& region : regions->GetArray()) {
        if (!region.HasMember("addr")) continue;
        uint64_t start = number(region, "addr");
        if (start <= address && address < start + number(region, "vsize")) return &region;
    }
    return nullptr;
}

// The numbers of the text row (printed with -v -w -f bytes, which name
// categories in full) that ends with `category`: dirty, swapped, clean, reclaimable, wired, regions.
std::vector<uint64_t> textRow(const std::string& report, const std::string& category)
{
    std::istringstream lines(report);
    std::string line;
    const std::string ending = "    " + category;
    while (std::getline(lines, line)) {
        if (line.size() < ending.size() || line.compare(line.size() - ending.size(), ending.size(), ending) != 0) {
            continue;
        }
        std::vector<uint64_t> numbers;
        std::istringstream words(line.substr(0, line.size() - ending.size()));
        std::string word;
        while (words >> word) {
            if (word != "B") numbers.push_back(std::strtoull(word.c_str(), nullptr, 10));
        }
        if (numbers.size() == 6) return numbers;
    }
    return {};
}

// The process's heft against the kernel's own count of what cannot be taken
// back from it: written and swapped pages of all its mappings plus its page
// tables, read right after heft ran while the child sat still. `cleanedSince`
// is how much of the count writeback may have cleaned in between (dirty
// pages of shared file mappings); anonymous memory of a blocked process
// stays as it is, so for it the two must agree exactly.
void expectHeftMatchesKernel(const rapidjson::Value& process, pid_t pid, uint64_t cleanedSince = 0)
{
    uint64_t heft = number(process, "heft");
    uint64_t kernel = kernelHeft(pid);
    EXPECT_GE(heft, kernel) << "pid " << pid;
    EXPECT_LE(heft, kernel + cleanedSince) << "pid " << pid;
}

class HTLiveProcessE2ETest : public testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_TRUE(directory_.ok()) << "mkdtemp: " << std::strerror(errno);
        if (LayoutProgram::shared().path().empty()) GTEST_SKIP() << LayoutProgram::shared().reason();
    }

    // Runs heft with -v and the JSON report, and parses the report.
    Outcome runForReport(std::vector<std::string> arguments, rapidjson::Document& report)
    {
        std::string path = directory_.file("report.json");
        unlink(path.c_str());
        arguments.insert(arguments.begin(), {"-v", "-w", "-f", "bytes", "-j", path});
        Outcome outcome = runHeft(arguments);
        EXPECT_EQ(outcome.status, 0) << outcome.standardError;
        loadReport(path, report);
        return outcome;
    }

    TempDir directory_;
};

TEST_F(HTLiveProcessE2ETest, AnonymousMemoryIsDirtyReclaimableOrWiredAsLaidOut)
{
    constexpr uint64_t kWritten = 64 * kMiB;
    constexpr uint64_t kFreed = 16 * kMiB;
    constexpr uint64_t kLocked = 4 * kMiB;
    LaidOutChild child({"anonymous", std::to_string(kWritten), std::to_string(kFreed), std::to_string(kLocked)});
    ASSERT_TRUE(child.ready());

    rapidjson::Document report;
    Outcome text = runForReport({child.pidString()}, report);
    const rapidjson::Value* process = processIn(report, child.pid());
    ASSERT_NE(process, nullptr);
    expectHeftMatchesKernel(*process, child.pid());
    const uint64_t lockedAddress = child.value(3) == 0 ? child.value(2) : 0;

    // Each mapping is one region of its exact size. Every written page is
    // resident and dirty (nothing pushes a blocked child's pages out on a
    // machine without memory pressure), so the figures are exact.
    const rapidjson::Value* written = regionContaining(*process, child.value(0));
    ASSERT_NE(written, nullptr);
    EXPECT_EQ(number(*written, "addr"), child.value(0));
    EXPECT_EQ(number(*written, "vsize"), kWritten);
    EXPECT_EQ(number(*written, "dirty") + number(*written, "swapped"), kWritten);
    EXPECT_EQ(number(*written, "reclaimable"), 0u);
    EXPECT_EQ(number(*written, "wired"), 0u);
    EXPECT_EQ((*written)["name"].GetString(), std::string(kUntagged));

    // Lazily freed pages are the kernel's to take at any moment, so heft's
    // figure lies between what the kernel still holds after heft ran and the
    // whole mapping; they are neither dirty nor part of the heft.
    const rapidjson::Value* freed = regionContaining(*process, child.value(1));
    ASSERT_NE(freed, nullptr);
    uint64_t lazyFreeAfter = smapsOfMappingAt(child.pid(), child.value(1))["LazyFree"];
    EXPECT_GE(number(*freed, "reclaimable"), lazyFreeAfter);
    EXPECT_LE(number(*freed, "reclaimable"), kFreed);
    EXPECT_GT(lazyFreeAfter, kFreed / 2) << "the kernel reclaimed the freed pages at once";
    EXPECT_EQ(number(*freed, "dirty"), kFreed - number(*freed, "reclaimable") - number(*freed, "clean"));

    // A locked region is wired in full (locked pages cannot leave memory).
    if (lockedAddress != 0) {
        const rapidjson::Value* locked = regionContaining(*process, lockedAddress);
        ASSERT_NE(locked, nullptr);
        EXPECT_EQ(number(*locked, "vsize"), kLocked);
        EXPECT_EQ(number(*locked, "wired"), kLocked);
        EXPECT_EQ(number(*locked, "dirty"), kLocked);
    }

    // The category holds the three regions at least; other anonymous memory
    // of the child (its allocator's) adds to it.
    const rapidjson::Value* untagged = categoryIn(*process, kUntagged);
    ASSERT_NE(untagged, nullptr) << describe(categoryNames(*process));
    EXPECT_GE(number(*untagged, "dirty"), kWritten + (lockedAddress ? kLocked : 0));
    EXPECT_GE(number(*untagged, "reclaimable"), number(*freed, "reclaimable"));
    if (lockedAddress != 0) {
        EXPECT_GE(number(*untagged, "wired"), kLocked);
    }
    EXPECT_GE(number(*untagged, "regions"), 3u);
    EXPECT_GE(number(*process, "heft"), kWritten + (lockedAddress ? kLocked : 0));

    // The text report of the same run shows the same figures.
    EXPECT_NE(text.standardOutput.find(" [" + child.pidString() + "]: 64-bit\tHeft: " +
                                       std::to_string(number(*process, "heft")) + " B ("),
              std::string::npos)
        << text.standardOutput;
    std::vector<uint64_t> row = textRow(text.standardOutput, kUntagged);
    ASSERT_EQ(row.size(), 6u) << text.standardOutput;
    EXPECT_EQ(row[0], number(*untagged, "dirty"));
    EXPECT_EQ(row[4], number(*untagged, "wired"));
    EXPECT_EQ(row[5], number(*untagged, "regions"));
    if (lockedAddress == 0) {
        GTEST_SKIP() << "mlock: " << std::strerror(static_cast<int>(child.value(3))) << "; locked memory not checked";
    }
}

TEST_F(HTLiveProcessE2ETest, PagesPushedOutShowAsSwapped)
{
    SwapArea swap;
    if (!swap.available()) GTEST_SKIP() << "no swap: " << swap.reason();
    constexpr uint64_t kSize = 16 * kMiB;
    LaidOutChild child({"pageout", std::to_string(kSize)});
    ASSERT_TRUE(child.ready());
    if (child.value(1) != 0) GTEST_SKIP() << "MADV_PAGEOUT: " << std::strerror(static_cast<int>(child.value(1)));

    rapidjson::Document report;
    Outcome text = runForReport({child.pidString()}, report);
    const rapidjson::Value* process = processIn(report, child.pid());
    ASSERT_NE(process, nullptr);
    expectHeftMatchesKernel(*process, child.pid());

    // Swapped pages stay out while the child does not touch them: heft's
    // figure is the kernel's, exactly, and the rest of the mapping is dirty.
    uint64_t swappedByKernel = smapsOfMappingAt(child.pid(), child.value(0))["Swap"];
    EXPECT_GT(swappedByKernel, kSize / 2) << "the kernel left most pages in memory";
    const rapidjson::Value* region = regionContaining(*process, child.value(0));
    ASSERT_NE(region, nullptr);
    EXPECT_EQ(number(*region, "swapped"), swappedByKernel);
    EXPECT_EQ(number(*region, "dirty") + number(*region, "swapped"), kSize);

    // A category's dirty figure includes its swapped bytes.
    const rapidjson::Value* untagged = categoryIn(*process, kUntagged);
    ASSERT_NE(untagged, nullptr) << describe(categoryNames(*process));
    EXPECT_GE(number(*untagged, "swapped"), swappedByKernel);
    EXPECT_GE(number(*untagged, "dirty"), kSize);
    EXPECT_GE(number(*process, "heft"), kSize);

    std::vector<uint64_t> row = textRow(text.standardOutput, kUntagged);
    ASSERT_EQ(row.size(), 6u) << text.standardOutput;
    EXPECT_EQ(row[1], number(*untagged, "swapped"));
}

TEST_F(HTLiveProcessE2ETest, SegmentSharedByTwoProcessesCountsOnce)
{
    constexpr uint64_t kSize = 32 * kMiB;
    // Both children inherit the segment, and write every page of it.
    int segment = memfd_create("heft-e2e-segment", 0);
    ASSERT_GE(segment, 0) << std::strerror(errno);
    ASSERT_EQ(ftruncate(segment, static_cast<off_t>(kSize)), 0) << std::strerror(errno);
    const std::string segmentPath = "/proc/self/fd/" + std::to_string(segment);
    LaidOutChild first({"file", segmentPath, std::to_string(kSize)});
    LaidOutChild second({"file", segmentPath, std::to_string(kSize)});
    close(segment);
    ASSERT_TRUE(first.ready());
    ASSERT_TRUE(second.ready());

    rapidjson::Document report;
    Outcome outcome = runForReport({first.pidString(), second.pidString()}, report);
    const rapidjson::Value* firstProcess = processIn(report, first.pid());
    const rapidjson::Value* secondProcess = processIn(report, second.pid());
    ASSERT_NE(firstProcess, nullptr);
    ASSERT_NE(secondProcess, nullptr);
    expectHeftMatchesKernel(*firstProcess, first.pid());
    expectHeftMatchesKernel(*secondProcess, second.pid());

    // Both map the whole segment, so it belongs to neither alone: it is in
    // exactly one shared table, the one of the two of them, whole. Shared
    // memory is named by its kind alone, and is the only shared memory of
    // these processes.
    const std::set<int> both = {first.pid(), second.pid()};
    int tablesWithSegment = 0;
    ASSERT_TRUE(report["shared"].IsArray());
    for (const auto& shared : report["shared"].GetArray()) {
        const rapidjson::Value* category = categoryIn(shared, "shared memory");
        if (!category) continue;
        ++tablesWithSegment;
        std::set<int> pids;
        for (const auto& pid : shared["pids"].GetArray()) pids.insert(pid.GetInt());
        EXPECT_EQ(pids, both);
        EXPECT_FALSE(shared.HasMember("specific_to_pid"));
        EXPECT_EQ(number(*category, "dirty"), kSize);
        EXPECT_EQ(number(*category, "regions"), 2u);
    }
    EXPECT_EQ(tablesWithSegment, 1);
    for (const rapidjson::Value* process : {firstProcess, secondProcess}) {
        EXPECT_EQ(categoryIn(*process, "shared memory"), nullptr) << "the segment is listed as one process's own";
        const rapidjson::Value* region = regionContaining(*process, process == firstProcess ? first.value(0)
                                                                                               : second.value(0));
        ASSERT_NE(region, nullptr);
        EXPECT_EQ(std::string((*region)["name"].GetString()), "shared memory");
        EXPECT_EQ(number(*region, "dirty"), kSize);
    }

    // Each heft holds the whole segment; the summary holds it once. Nothing
    // else is one object with the same pages in both processes: their
    // private memory, the library pages each copied on write and their page
    // tables are each their own. So the summary is the two hefts less
    // exactly one copy of the segment.
    uint64_t firstHeft = number(*firstProcess, "heft");
    uint64_t secondHeft = number(*secondProcess, "heft");
    EXPECT_GE(firstHeft, kSize);
    EXPECT_GE(secondHeft, kSize);
    uint64_t totalHeft = number(report, "total heft");
    EXPECT_EQ(totalHeft + kSize, firstHeft + secondHeft);
    EXPECT_EQ(totalHeft, number(report["summary"]["total"], "dirty"));

    // The text report names the other process over the shared table and
    // gives the summary across both.
    const std::string name = (*firstProcess)["name"].GetString();
    EXPECT_NE(outcome.standardOutput.find("Shared with " + name + " [" + second.pidString() + "]:\n"),
              std::string::npos)
        << outcome.standardOutput;
    EXPECT_NE(outcome.standardOutput.find("Shared with " + name + " [" + first.pidString() + "]:\n"),
              std::string::npos);
    EXPECT_NE(outcome.standardOutput.find("\nSummary Heft: "), std::string::npos);
}

TEST_F(HTLiveProcessE2ETest, FileMappingsAndLibrariesAreNamedByPath)
{
    constexpr uint64_t kSize = 8 * kMiB;
    const std::string path = directory_.file("mapped.bin");
    {
        int fd = open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
        ASSERT_GE(fd, 0) << std::strerror(errno);
        ASSERT_EQ(ftruncate(fd, static_cast<off_t>(kSize)), 0);
        close(fd);
    }
    LaidOutChild child({"file", path, std::to_string(kSize)});
    ASSERT_TRUE(child.ready());

    rapidjson::Document report;
    Outcome text = runForReport({child.pidString()}, report);
    const rapidjson::Value* process = processIn(report, child.pid());
    ASSERT_NE(process, nullptr);
    // Writeback may clean the file's written pages at any moment after heft
    // read them (never the other way round while the child sits still).
    uint64_t fileDirtyAfter = smapsOfMappingAt(child.pid(), child.value(0))["Private_Dirty"] +
                              smapsOfMappingAt(child.pid(), child.value(0))["Shared_Dirty"];
    expectHeftMatchesKernel(*process, child.pid(), kSize - fileDirtyAfter);

    // All its pages are resident, dirty until written back and clean after.
    const rapidjson::Value* file = categoryIn(*process, "mapped file " + path);
    ASSERT_NE(file, nullptr) << describe(categoryNames(*process));
    EXPECT_EQ(number(*file, "dirty") + number(*file, "clean"), kSize);
    EXPECT_GE(number(*file, "dirty"), fileDirtyAfter);
    EXPECT_EQ(number(*file, "regions"), 1u);
    const rapidjson::Value* region = regionContaining(*process, child.value(0));
    ASSERT_NE(region, nullptr);
    EXPECT_EQ((*region)["name"].GetString(), "mapped file " + path);

    // The C library is an image: its segments are named by their role and
    // its path, its code among them.
    std::vector<std::string> names = categoryNames(*process);
    EXPECT_TRUE(std::any_of(names.begin(), names.end(), [](const std::string& name) {
        return name.rfind("__TEXT /", 0) == 0 && name.find("/libc.so") != std::string::npos;
    })) << describe(names);
    auto libcText = std::find_if(names.begin(), names.end(), [](const std::string& name) {
        return name.rfind("__TEXT /", 0) == 0 && name.find("/libc.so") != std::string::npos;
    });
    if (libcText != names.end()) {
        const rapidjson::Value* text = categoryIn(*process, *libcText);
        EXPECT_GT(number(*text, "clean") + number(*text, "dirty"), 0u);
    }

    std::vector<uint64_t> row = textRow(text.standardOutput, "mapped file " + path);
    ASSERT_EQ(row.size(), 6u) << text.standardOutput;
    EXPECT_EQ(row[0], number(*file, "dirty"));
    EXPECT_EQ(row[2], number(*file, "clean"));
}

TEST_F(HTLiveProcessE2ETest, ProcessesExitingDuringTheRunLeaveAWholeReport)
{
    if (geteuid() != 0) GTEST_SKIP() << "-a needs root";
    // Short-lived processes keep coming and going while heft runs: each maps
    // and writes some memory and exits after a few milliseconds.
    LaidOutChild churn({"churn"});
    ASSERT_TRUE(churn.ready());
    const std::string path = directory_.file("all.json");
    int runsWithExitedProcesses = 0;
    for (int run = 0; run < 10; ++run) {
        // The test's own process is left out: built with a sanitizer, it
        // reserves terabytes of shadow memory, and measuring that is not what
        // this test is about.
        Outcome outcome = runHeft({"-a", "-x", std::to_string(getpid()), "-j", path});
        EXPECT_EQ(outcome.status, 0) << "run " << run << ":\n" << outcome.standardError;
        EXPECT_NE(outcome.standardOutput.find("\nSummary Heft: "), std::string::npos)
            << "run " << run << ":\n" << outcome.standardOutput.substr(0, 2000);
        rapidjson::Document report;
        if (loadReport(path, report)) {
            EXPECT_TRUE(report.HasMember("total heft")) << "run " << run;
            EXPECT_GT(report["processes"].Size(), 1u) << "run " << run;
        }
        if (outcome.standardError.find("(process exited)") != std::string::npos) ++runsWithExitedProcesses;
    }
    RecordProperty("runsThatSawAProcessExit", runsWithExitedProcesses);
}

TEST_F(HTLiveProcessE2ETest, UnprivilegedUserAnalysesOnlyItsOwnProcesses)
{
    if (geteuid() != 0) GTEST_SKIP() << "running heft as another user needs root";
    if (access(kSetpriv, X_OK) != 0) GTEST_SKIP() << kSetpriv << " is needed to change the user";
    ASSERT_EQ(chmod(directory_.path().c_str(), 0777), 0);
    constexpr uint64_t kSize = 8 * kMiB;
    LaidOutChild child({"anonymous", std::to_string(kSize), "4096", "4096"}, kNobody);
    ASSERT_TRUE(child.ready());

    const std::string path = directory_.file("nobody.json");
    Outcome outcome = runHeftAsNobody({"-v", "-j", path, child.pidString(), "1"});
    EXPECT_EQ(outcome.status, 0) << outcome.standardError;
    EXPECT_NE(outcome.standardError.find("Unable to analyze process with pid 1 (try as root?)\n"), std::string::npos)
        << outcome.standardError;
    rapidjson::Document report;
    ASSERT_TRUE(loadReport(path, report));
    EXPECT_EQ(processIn(report, 1), nullptr);
    const rapidjson::Value* process = processIn(report, child.pid());
    ASSERT_NE(process, nullptr);
    // Without root the page flags are hidden, but the region figures come
    // from the process's own smaps, which its owner may read in full.
    expectHeftMatchesKernel(*process, child.pid());
    const rapidjson::Value* region = regionContaining(*process, child.value(0));
    ASSERT_NE(region, nullptr);
    EXPECT_EQ(number(*region, "dirty") + number(*region, "swapped"), kSize);
    EXPECT_GE(number(*process, "heft"), kSize);

    outcome = runHeftAsNobody({"-a"});
    EXPECT_EQ(outcome.status, 1);
    EXPECT_EQ(outcome.standardError, "Must run as root.\n");
}

}  // namespace
