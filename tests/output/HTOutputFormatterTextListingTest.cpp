// The text report's region listing, process headers, run diagnostics and
// auxiliary data, compared in full with texts written out by hand.

#include "output/HTOutputFormatterText.h"

#include "model/HTAuxData.h"
#include "model/HTAuxDataMap.h"
#include "model/HTMemoryRegion.h"
#include "platform/fake/HTFakePlatform.h"
#include "process/HTProcess.h"

#include "output/HTOutputCapture.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <initializer_list>
#include <memory>
#include <string>
#include <utility>
#include <vector>

namespace {

using Capture = HTOutputCapture;

// A process source that failed: errors can only be added from inside.
class FailedProcess : public HTProcess {
public:
    using HTProcess::HTProcess;
    void fail(std::string error) { addError(std::move(error)); }
};

std::shared_ptr<FailedProcess> process(int32_t pid, const std::string& name, uint64_t pageSize = 4096)
{
    auto made = std::make_shared<FailedProcess>(std::make_shared<HTFakePlatform>());
    made->setPid(pid);
    made->setName(name);
    made->setDisplayString(name + " [" + std::to_string(pid) + "]");
    made->setIs64bit(true);
    made->setPageSize(pageSize);
    return made;
}

std::shared_ptr<HTMemoryRegion> region(uint64_t start, uint64_t size, uint64_t objectId, const char* name,
                                       std::optional<std::string> detail = std::nullopt)
{
    auto made = std::make_shared<HTMemoryRegion>();
    made->setStart(start);
    made->setSize(size);
    made->setObject_id(objectId);
    made->setName(name);
    made->setDetailedName(std::move(detail));
    return made;
}

std::shared_ptr<HTAuxDataMap> auxMap(std::initializer_list<std::pair<std::string, HTAuxDataMap::Value>> entries)
{
    auto made = std::make_shared<HTAuxDataMap>();
    for (const auto& [key, value] : entries) made->set(key, value);
    return made;
}

HTAuxDataMap::Value datum(int64_t value) { return std::make_shared<HTAuxData>(value, true); }

const std::string kRule70(70, '=');

}  // namespace

TEST(HTOutputFormatterTextListing, RegionListingWithBothExtraColumns)
{
    // Sizes that are not whole pages round up; the object id keeps its low
    // 40 bits; a region without an address shows as unmapped.
    auto text = region(0x100000, 2 * 4096 + 1, 0x123456789abcULL, "__TEXT", "/usr/lib/libexample");
    text->setDirtySize(4096);
    text->setSwappedSize(1);
    text->setCleanNonSpecSize(4096);
    text->setWired(true);
    auto owned = region(HTNoAddress, 4096, 0x2a, "owned unmapped memory");
    owned->setDirtySize(4096);
    owned->setReclaimableSize(4095);

    Capture out;
    HTOutputFormatterText formatter(HTTextFormatBytes, HTTextOptionSwapped | HTTextOptionWired, "Dirty", true,
                                    out.file());
    EXPECT_TRUE(formatter.respondsToSpanlistLikeOutput());
    formatter.printSpanlistLikeOutputForProcess(*process(812, "cat"), {text, owned});
    EXPECT_EQ(out.take(),
              "cat [812]\n"
              "\n"
              "           start                end  [objectid]      VRT     DRT     SWP     CLN     RCL    WIRE"
              "   tag (detail)\n"
              "      ----------         ----------  ----------    -----   -----   -----   -----   -----   -----"
              "   ------------\n"
              "          100000 -           102001 [3456789abc]       3       2       1       1       0       3"
              "   __TEXT .../libexample\n"
              "        unmapped -         unmapped [        2a]       1       1       0       0       1       0"
              "   owned unmapped memory\n"
              "\n");
}

TEST(HTOutputFormatterTextListing, WideListingWithoutPageSizeAndEmptyListing)
{
    auto text = region(0x7f0000001000, 4096, 7, "__TEXT", "/usr/lib/libexample");
    text->setDirtySize(4096);

    Capture out;
    HTOutputFormatterText formatter(HTTextFormatFormatted, HTTextOptionWide, "Dirty", true, out.file());
    formatter.printSpanlistLikeOutputForProcess(*process(9, "odd", 0), {text});
    formatter.printSpanlistLikeOutputForProcess(*process(10, "idle"), {});
    EXPECT_EQ(out.take(),
              "odd [9]\n"
              "\n"
              "           start                end  [objectid]      VRT     DRT     CLN     RCL   tag (detail)\n"
              "      ----------         ----------  ----------    -----   -----   -----   -----   ------------\n"
              "    7f0000001000 -     7f0000002000 [         7]       0       0       0       0"
              "   __TEXT /usr/lib/libexample\n"
              "\n"
              "idle [10]\n"
              "\n"
              "           start                end  [objectid]      VRT     DRT     CLN     RCL   tag (detail)\n"
              "      ----------         ----------  ----------    -----   -----   -----   -----   ------------\n"
              "\n");
}

TEST(HTOutputFormatterTextListing, ProcessHeaders)
{
    Capture out;
    HTOutputFormatterText formatter(HTTextFormatFormatted, 0, "Dirty", true, out.file());

    // A clean process: the heft follows on the identity line.
    auto clean = process(812, "cat", 16384);
    formatter.printProcessHeader(*clean);
    formatter.printProcessTotal(3 * 16384, *clean);
    formatter.endProcessHeader(*clean);
    EXPECT_EQ(out.take(), kRule70 + "\n" + "cat [812]: 64-bit\tHeft: 48 KB (16384 bytes per page)\n" + kRule70 +
                              "\n\n");
    EXPECT_EQ(formatter.processCount(), 1);
    EXPECT_EQ(formatter.pageSize(), 16384u);

    auto warned = process(7, "old");
    warned->setIs64bit(false);
    warned->warnings() = {"process exited while being examined", "second warning"};
    formatter.printProcessHeader(*warned);
    formatter.printProcessTotal(0, *warned);
    formatter.endProcessHeader(*warned);
    EXPECT_EQ(out.take(), kRule70 + "\n" +
                              "old [7]: 32-bit\n"
                              "Warnings were encountered while examining the process.\n"
                              "\tprocess exited while being examined\n"
                              "\tsecond warning\n"
                              "\tHeft: 0 B (4096 bytes per page)\n" +
                              kRule70 + "\n\n");
    EXPECT_EQ(formatter.pageSize(), 4096u);

    // A failed process gets no heft; its warnings come before its errors.
    auto failed = process(9, "bad");
    failed->warnings() = {"w"};
    failed->fail("task_for_pid failed");
    failed->fail("second error");
    formatter.printProcessHeader(*failed);
    formatter.endProcessHeader(*failed);
    EXPECT_EQ(out.take(), kRule70 + "\n" +
                              "bad [9]: 64-bit\n"
                              "Warnings were encountered while examining the process.\n"
                              "\tw\n"
                              "\n"
                              "Errors were encountered while examining the process. No results gathered.\n"
                              "\ttask_for_pid failed\n"
                              "\tsecond error\n" +
                              kRule70 + "\n\n");
    EXPECT_EQ(formatter.processCount(), 2);
}

TEST(HTOutputFormatterTextListing, HeaderRuleGrowsWithExtraColumns)
{
    Capture out;
    HTOutputFormatterText formatter(HTTextFormatBytes, HTTextOptionWide | HTTextOptionSwapped | HTTextOptionWired,
                                    "Dirty", true, out.file());
    auto cat = process(812, "cat");
    formatter.printProcessHeader(*cat);
    formatter.printProcessTotal(4096, *cat);
    formatter.endProcessHeader(*cat);
    const std::string rule90(90, '=');
    EXPECT_EQ(out.take(), rule90 + "\ncat [812]: 64-bit\tHeft: 4096 B (4096 bytes per page)\n" + rule90 + "\n\n");
}

TEST(HTOutputFormatterTextListing, RunDiagnostics)
{
    Capture out;
    HTOutputFormatterText formatter(HTTextFormatFormatted, 0, "Dirty", true, out.file());
    formatter.printProcessesWithWarnings({}, {}, {});
    EXPECT_EQ(out.take(), "");

    // Warnings alone do not make the summary doubtful.
    formatter.printProcessesWithWarnings({process(1, "launchd"), process(2, "cat")}, {}, {});
    EXPECT_EQ(out.take(),
              "\nWarnings were encountered while examining the following processes:\n"
              "\tlaunchd\n"
              "\tcat\n");

    formatter.printProcessesWithWarnings({process(1, "launchd")}, {process(3, "bad")},
                                         {"task_for_pid(4) failed", "interrupted"});
    EXPECT_EQ(out.take(),
              "\nWarnings were encountered while examining the following processes:\n"
              "\tlaunchd\n"
              "\nErrors were encountered while examining the following processes:\n"
              "\tbad\n"
              "\nErrors were encountered:\n"
              "\ttask_for_pid(4) failed\n"
              "\tinterrupted\n"
              "\nDue to errors, summary results may be invalid\n");

    formatter.printProcessesWithWarnings({}, {}, {"interrupted"});
    EXPECT_EQ(out.take(),
              "\nErrors were encountered:\n"
              "\tinterrupted\n"
              "\nDue to errors, summary results may be invalid\n");
}

TEST(HTOutputFormatterTextListing, ProcessAuxData)
{
    Capture out;
    HTOutputFormatterText formatter(HTTextFormatFormatted, 0, "Dirty", true, out.file());

    // Keys in the order they were set, each level one tab further in.
    formatter.printProcessAuxData(auxMap({
        {"phys_heft", datum(16384)},
        {"ledger", auxMap({{"page_table", datum(4096)}, {"purgeable", auxMap({{"volatile", datum(0)}})}})},
        {"tail", datum(1024)},
    }));
    EXPECT_EQ(out.take(),
              "Auxiliary data:\n"
              "\tphys_heft: 16 KB\n"
              "\tledger:\n"
              "\t\tpage_table: 4096 B\n"
              "\t\tpurgeable:\n"
              "\t\t\tvolatile: 0 B\n"
              "\ttail: 1024 B\n"
              "\n");

    formatter.printProcessAuxData(std::make_shared<HTAuxDataMap>());
    EXPECT_EQ(out.take(), "Auxiliary data:\n\n");
    formatter.printProcessAuxData(nullptr);
    EXPECT_EQ(out.take(), "");

    // Values follow the summary format.
    HTOutputFormatterText pages(HTTextFormatPages, 0, "Dirty", true, out.file());
    pages.setPageSize(4096);
    pages.printProcessAuxData(auxMap({{"phys_heft", datum(4097)}}));
    EXPECT_EQ(out.take(), "Auxiliary data:\n\tphys_heft: 2 pages\n\n");
}

TEST(HTOutputFormatterTextListing, GlobalAuxDataOnlyForSeveralProcesses)
{
    Capture out;
    HTOutputFormatterText formatter(HTTextFormatBytes, 0, "Dirty", true, out.file());
    auto data = auxMap({{"phys_heft", datum(8192)}});

    formatter.printProcessHeader(*process(1, "a"));
    out.take();
    formatter.printGlobalAuxData(data);
    EXPECT_EQ(out.take(), "");

    formatter.printProcessHeader(*process(2, "b"));
    out.take();
    formatter.printGlobalAuxData(data);
    EXPECT_EQ(out.take(), "\nAuxiliary data:\n\tphys_heft: 8192 B\n\n");
    formatter.printGlobalAuxData(nullptr);
    EXPECT_EQ(out.take(), "\n");

    formatter.end();
}
