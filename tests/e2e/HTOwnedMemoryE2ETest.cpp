// Shared memory that processes hold without mapping it: charged to its owner, counted once.

#include "e2e/HTE2ESupport.h"

#include <sys/mount.h>
#include <sys/shm.h>
#include <sys/vfs.h>

namespace {

using namespace heft_e2e;

using HTOwnedMemoryE2ETest = HTE2EReportTest;

constexpr const char* kOwned = "Owned physical heft (unmapped)";
constexpr long kTmpfsMagic = 0x01021994;

// The System V segment `shmid`, removed with this object.
struct SegmentRemoval {
    ~SegmentRemoval()
    {
        if (shmid >= 0) shmctl(shmid, IPC_RMID, nullptr);
    }
    int shmid = -1;
};

TEST_F(HTOwnedMemoryE2ETest, MemoryHeldButNotMappedIsItsHoldersOwn)
{
    SwapArea swap;  // without one the paged-out pages stay in memory, dirty
    struct statfs shm {};
    const bool shmIsTmpfs = statfs("/dev/shm", &shm) == 0 && shm.f_type == kTmpfsMagic;
    const std::string held = "/dev/shm/heft-e2e-held-" + std::to_string(getpid());
    // A memfd of 64 MiB with 16 paged out, a System V segment of 8 MiB, a deleted tmpfs file of 4 MiB: none mapped.
    ASSERT_TRUE(
        layOutAndMeasure({"memfd", n(64 * kMiB), n(16 * kMiB), "sysv", n(8 * kMiB), "tmpfile", held, n(4 * kMiB)}));
    SegmentRemoval segment{static_cast<int>(child_->value(1))};
    const rapidjson::Value* process = processIn(report_, child_->pid());
    ASSERT_NE(process, nullptr);

    const uint64_t files = 72 * kMiB + (shmIsTmpfs ? 4 * kMiB : 0);
    // Dirty holds the swapped part too.
    EXPECT_EQ(figure(process, kOwned, "dirty"), files);
    EXPECT_EQ(figure(process, kOwned, "regions"), shmIsTmpfs ? 3u : 2u);
    // MADV_PAGEOUT may leave a few pages in memory (one under reclaim at the moment), so half is the bound.
    if (swap.available) {
        EXPECT_GE(figure(process, kOwned, "swapped"), 8 * kMiB);
    }
    EXPECT_GE(number(process, "heft"), files);

    // Without root, a process of the caller's own still shows what it holds, and heft says what it could not see.
    if (const std::string why = whyNobodyCannotRun(); why.empty()) {
        HTLayoutChild nobodys({"memfd", n(8 * kMiB), "0"}, 65534);
        ASSERT_TRUE(nobodys.ready());
        const Outcome run = runHeftAsNobody({"-f", "bytes", nobodys.pidString()});
        EXPECT_THAT(run.standardOutput, testing::ContainsRegex("8388608 B .* Owned physical heft"));
        EXPECT_THAT(run.standardError, testing::HasSubstr("Unable to read the open files of "));
    }
    if (!shmIsTmpfs) GTEST_SKIP() << "/dev/shm is no tmpfs here; its file was not checked";
}

TEST_F(HTOwnedMemoryE2ETest, FilesOfATmpfsAreTheirHoldersTheirMappersOrNobodys)
{
    // A tmpfs of the test's own: a file held and mapped (as a journal under /run is), one held alone, one mapped
    // alone, and one that nobody holds or maps.
    const std::string mount = directory_.file("tmpfs");
    if (geteuid() != 0 || mkdir(mount.c_str(), 0700) != 0 || ::mount("none", mount.c_str(), "tmpfs", 0, nullptr) != 0)
        GTEST_SKIP() << "mounting a tmpfs needs root";
    for (const auto& [name, size] : {std::pair{"/mapped-alone", 1 * kMiB}, {"/nobodys", 3 * kMiB}}) {
        std::ofstream(mount + name) << std::string(size, 'x');
    }
    const bool measured = layOutAndMeasure({"heldfile", mount + "/mapped", n(4 * kMiB), "tmpfile", mount + "/held",
                                            n(2 * kMiB), "file", mount + "/mapped-alone", n(kMiB), "0"});
    const std::string kernelPath = directory_.file("kernel.json");
    const Outcome kernel = runHeft({"-f", "bytes", "-j", kernelPath, "0"});
    const pid_t pid = child_->pid();
    child_.reset();
    umount(mount.c_str());
    ASSERT_TRUE(measured);
    const rapidjson::Value* process = processIn(report_, pid);
    EXPECT_EQ(figure(process, kOwned, "dirty"), 2 * kMiB);
    // Listed with -v, a file's mappings are a row of its own.
    EXPECT_EQ(figure(process, "mapped file " + mount + "/mapped", "dirty"), 4 * kMiB);

    // The kernel's report holds the one file that belongs to nobody.
    ASSERT_EQ(kernel.status, 0) << kernel.standardError;
    ASSERT_TRUE(loadReport(kernelPath, report_));
    EXPECT_EQ(figure(processIn(report_, 0), "tmpfs files no process holds or maps (" + mount + ")", "dirty"), 3 * kMiB);
}

TEST_F(HTOwnedMemoryE2ETest, SegmentOfAnExitedCreatorThatNobodyMapsIsInTheKernelsReport)
{
    if (geteuid() != 0) GTEST_SKIP() << "the kernel's report needs root";
    const Outcome created = runProgram(HEFT_LAYOUT_PROGRAM, {"heft-layout", "sysv", n(8 * kMiB), "exit"});
    ASSERT_EQ(created.status, 0) << created.standardError;
    SegmentRemoval segment{std::stoi(created.standardOutput)};
    const std::string path = directory_.file("kernel.json");
    ASSERT_EQ(runHeft({"-f", "bytes", "-j", path, "0"}).status, 0);
    ASSERT_TRUE(loadReport(path, report_));
    EXPECT_GE(figure(processIn(report_, 0), "System V shared memory of exited processes", "dirty"), 8 * kMiB);
}

TEST_F(HTOwnedMemoryE2ETest, SharedMemoryOfTheWholeMachineAgreesWithTheKernelsShmem)
{
    struct statfs shm {};
    if (geteuid() != 0) GTEST_SKIP() << "heft -a needs root";
    if (statfs("/dev/shm", &shm) != 0 || shm.f_type != kTmpfsMagic) GTEST_SKIP() << "/dev/shm is no tmpfs here";
    // 600 MiB of shared memory: a memfd and a System V segment held unmapped, a /dev/shm file mapped, not held.
    const std::string file = "/dev/shm/heft-e2e-shmem-" + std::to_string(getpid());
    std::ofstream(file).close();
    ASSERT_EQ(truncate(file.c_str(), 200 * kMiB), 0) << std::strerror(errno);
    HTLayoutChild holder(
        {"memfd", n(200 * kMiB), "0", "sysv", n(200 * kMiB), "file", file, n(200 * kMiB), n(200 * kMiB)});
    unlink(file.c_str());
    ASSERT_TRUE(holder.ready());
    SegmentRemoval segment{static_cast<int>(holder.value(1))};
    const std::string path = directory_.file("all.json");
    ASSERT_EQ(runHeft({"-a", "-f", "bytes", "-j", path}).status, 0);
    const uint64_t shmem = kernelField(readFile("/proc/meminfo"), "Shmem");
    ASSERT_TRUE(loadReport(path, report_));

    // What is in memory of the shared memory heft reports: mapped, owned and unmapped, and belonging to nobody.
    uint64_t reported = 0;
    const rapidjson::Value* summary = member(&report_, "summary");
    ASSERT_TRUE(summary != nullptr && summary->IsObject());
    for (const auto& [name, row] : summary->GetObject()) {
        const std::string category = name.GetString();
        if (category == "shared memory" || category == kOwned || category.starts_with("System V shared memory of") ||
            category.starts_with("tmpfs files no process holds"))
            reported += number(&row, "dirty") - number(&row, "swapped") + number(&row, "clean");
    }
    EXPECT_NEAR(static_cast<double>(reported), static_cast<double>(shmem), 0.05 * static_cast<double>(shmem));
}

TEST_F(HTOwnedMemoryE2ETest, MemoryMappedByAnotherCountsOnceAndIsChargedToItsOwner)
{
    ASSERT_TRUE(layOutAndMeasure({"memfd", n(32 * kMiB), "0"}));
    const pid_t owner = child_->pid();
    // Another process maps the owner's memfd and writes it all.
    HTLayoutChild mapper({"file", "/proc/" + n(owner) + "/fd/" + n(child_->value(0)), n(32 * kMiB), n(32 * kMiB)});
    ASSERT_TRUE(mapper.ready());
    const std::string path = directory_.file("both.json");
    const Outcome run = runHeft({"-f", "bytes", "-j", path, n(owner), mapper.pidString()});
    ASSERT_EQ(run.status, 0) << run.standardError;
    ASSERT_TRUE(loadReport(path, report_));

    // The table of what the two share holds the memfd dirty, as its owner sees it; the mapper's own view of it
    // clean; the run's total counts it once.
    const rapidjson::Value* shared = sharedBy(report_, {owner, mapper.pid()});
    ASSERT_NE(shared, nullptr);
    EXPECT_EQ(figure(shared, "shared memory", "dirty"), 32 * kMiB);
    const rapidjson::Value* mapperView = nullptr;
    for (const auto& view : arrayIn(&report_, "shared"))
        if (number(&view, "specific_to_pid") == static_cast<uint64_t>(mapper.pid())) mapperView = &view;
    EXPECT_EQ(figure(mapperView, "shared memory", "dirty"), 0u);
    EXPECT_EQ(figure(mapperView, "shared memory", "clean"), 32 * kMiB);
    EXPECT_LT(number(&report_, "total heft"), 48 * kMiB);

    // With --unmapped, the owner alone is reported, charged with the memfd that only the other maps.
    const Outcome unmapped = runHeft({"-f", "bytes", "-j", path, "--unmapped", n(owner)});
    ASSERT_EQ(unmapped.status, 0) << unmapped.standardError;
    ASSERT_TRUE(loadReport(path, report_));
    EXPECT_GE(number(processIn(report_, owner), "heft"), 32 * kMiB);
}

}  // namespace
