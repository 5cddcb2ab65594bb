#include "analysis/HTHeftTestSupport.h"
#include "model/HTAuxData.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using HTHeftReportTest = HTAnalysisTest;

std::shared_ptr<HTAuxDataMap> auxWith(int64_t x)
{
    auto data = std::make_shared<HTAuxDataMap>();
    data->set("x", std::make_shared<HTAuxData>(x, true));
    return data;
}

// The lines that begin with `prefix`.
std::vector<std::string> linesStartingWith(const std::vector<std::string>& log, const std::string& prefix)
{
    std::vector<std::string> found;
    for (const auto& line : log)
        if (line.rfind(prefix, 0) == 0) found.push_back(line);
    return found;
}

TEST_F(HTHeftReportTest, OneProcessWithItsListing)
{
    HTScriptedRegion library{.objectId = 2,
                             .clean = kPage,
                             .name = std::string("lib"),
                             .detailedName = std::string("a.so")};
    auto p10 = process(10, {dirtyPages(1, 2, "heap"), library});
    p10->setAuxData(auxWith(5));

    EXPECT_THAT(report({p10}, /*verbose=*/true),
                ElementsAre("X listing 10 regions=2", "X header 10", "X heft 10 2", "X endHeader 10",
                            "X private [heap(d2 s0 c0 r0 w0 n1), lib a.so(d0 s0 c1 r0 w0 n1)] total d2 s0 c1 r0 w0 n2",
                            "X aux {x=5}", "X diagnostics warnings{} errors{}",
                            "X summary [heap(d2 s0 c0 r0 w0 n1), lib a.so(d0 s0 c1 r0 w0 n1)] total d2 s0 c1 r0 w0 n2",
                            "X globalAux {x=5}", "X end"));
}

TEST_F(HTHeftReportTest, TwoFormattersReceiveEachStageInTurn)
{
    auto p10 = process(10, {dirtyPages(1, 1, "shm"), dirtyPages(2, 2, "heap")});
    auto p20 = process(20, {dirtyPages(1, 1, "shm")});
    auto heft = gathered({p20, p10});
    auto log = std::make_shared<HTRecordingFormatter::Log>();
    heft->addOutputFormatter(std::make_shared<HTRecordingFormatter>("X", log, true));
    heft->addOutputFormatter(std::make_shared<HTRecordingFormatter>("Y", log));
    heft->printOutputVerbose(/*verbose=*/true, false);

    const std::string heap = "[heap(d2 s0 c0 r0 w0 n1)] total d2 s0 c0 r0 w0 n1";
    const std::string shm = "[shm(d1 s0 c0 r0 w0 n2)] total d1 s0 c0 r0 w0 n2";
    const std::string summary = "summary [shm(d1 s0 c0 r0 w0 n2), heap(d2 s0 c0 r0 w0 n1)] total d3 s0 c0 r0 w0 n3";
    EXPECT_THAT(*log,
                ElementsAre(
                    // Only X lists regions; the listing comes first, in heft order.
                    "X listing 10 regions=2", "X listing 20 regions=1", "X header 10", "X heft 10 3", "X endHeader 10",
                    "Y header 10", "Y heft 10 3", "Y endHeader 10", "X private " + heap, "Y private " + heap,
                    "X shared {20,10} for 10 " + shm, "Y shared {20,10} for 10 " + shm, "X aux none", "Y aux none",
                    "X header 20", "X heft 20 1", "X endHeader 20", "Y header 20", "Y heft 20 1", "Y endHeader 20",
                    // All of p20's memory is shared: no private table.
                    "X shared {20,10} for 20 " + shm, "Y shared {20,10} for 20 " + shm, "X aux none", "Y aux none",
                    "X diagnostics warnings{} errors{}", "Y diagnostics warnings{} errors{}", "X " + summary,
                    "X globalAux none", "X end", "Y " + summary, "Y globalAux none", "Y end"));
}

TEST_F(HTHeftReportTest, SharedTablesShowEachProcessItsOwnView)
{
    // p30 maps both pages of the object, the others one each: the object
    // keeps each process's regions and every member sees its own figures.
    HTScriptedRegion secondPage = dirtyPages(7, 1, "shm");
    secondPage.offset = kPage;
    auto views = report({process(10, {dirtyPages(7, 1, "shm")}), process(20, {dirtyPages(7, 1, "shm")}),
                         process(30, {dirtyPages(7, 1, "shm"), secondPage})});
    EXPECT_THAT(linesStartingWith(views, "X shared"),
                ElementsAre("X shared {10,20,30} for 30 view [shm(d2 s0 c0 r0 w0 n2)] total d2 s0 c0 r0 w0 n2",
                            "X shared {10,20,30} for 20 view [shm(d1 s0 c0 r0 w0 n1)] total d1 s0 c0 r0 w0 n1",
                            "X shared {10,20,30} for 10 view [shm(d1 s0 c0 r0 w0 n1)] total d1 s0 c0 r0 w0 n1"));

    // Memory p10 owns is clean to p20; the summary counts it once, dirty.
    setBreakdown(true);
    HTScriptedRegion owned = dirtyPages(8, 1, "shm");
    owned.owned = true;
    auto ownership = report({process(10, {owned}), process(20, {dirtyPages(8, 1, "shm"), dirtyPages(9, 2, "heap")})});
    EXPECT_THAT(linesStartingWith(ownership, "X shared"),
                ElementsAre("X shared {10,20} for 20 view [shm(d0 s0 c1 r0 w0 n2)] total d0 s0 c1 r0 w0 n2",
                            "X shared {10,20} for 10 [shm(d1 s0 c0 r0 w0 n2)] total d1 s0 c0 r0 w0 n2"));
    EXPECT_THAT(ownership, ::testing::Contains(HasSubstr("X summary [shm(d1 s0 c0 r0 w0 n2), heap(d2")));
}

TEST_F(HTHeftReportTest, ProcessesWithErrorsGetNoTablesOrHeft)
{
    auto failed = process(10, {dirtyPages(2, 2, "a")});
    failed->scriptError("cannot read");
    failed->setAuxData(auxWith(5));
    auto warned = process(20, {dirtyPages(1, 1, "b")});
    warned->scriptWarning("exited");
    warned->setAuxData(auxWith(7));
    HTProcess::_addGlobalError("task port");

    EXPECT_THAT(report({warned, failed}),
                ElementsAre("X header 10", "X endHeader 10", "X private [] total d0 s0 c0 r0 w0 n0", "X aux {x=5}",
                            "X header 20", "X heft 20 1", "X endHeader 20",
                            "X private [b(d1 s0 c0 r0 w0 n1)] total d1 s0 c0 r0 w0 n1", "X aux {x=7}",
                            "X diagnostics warnings{20} errors{10} 'task port'",
                            "X summary [b(d1 s0 c0 r0 w0 n1), a(d2 s0 c0 r0 w0 n1)] total d3 s0 c0 r0 w0 n2 hadErrors",
                            "X globalAux {x=7}", "X end"));
}

TEST_F(HTHeftReportTest, HiddenProcessesHaveNoBlockOfTheirOwn)
{
    // The hidden process maps memory p10 owns and has a fake region for, so
    // it joins that memory's group; its other memory stays out of the report.
    setBreakdown(true);
    HTScriptedRegion owned = dirtyPages(1, 1, "shm");
    owned.owned = true;
    HTScriptedRegion unmapped = owned;
    unmapped.fake = true;
    auto hidden = process(30, {dirtyPages(1, 1, "shm"), dirtyPages(3, 4, "other")});
    hidden->setHiddenFromDisplay(true);
    auto log = report({process(10, {owned, unmapped, dirtyPages(2, 2, "heap")}), hidden});

    EXPECT_TRUE(linesStartingWith(log, "X header 30").empty());
    EXPECT_THAT(linesStartingWith(log, "X shared"), ElementsAre(HasSubstr("X shared {10,30} for 10 view [shm(")));
    EXPECT_THAT(log, ::testing::Not(::testing::Contains(HasSubstr("other"))));

    // Nothing visible: the formatters still get the closing stages.
    auto onlyHidden = process(30, {dirtyPages(3, 4, "other")});
    onlyHidden->setHiddenFromDisplay(true);
    EXPECT_THAT(report({onlyHidden}, /*verbose=*/true),
                ElementsAre("X diagnostics warnings{} errors{}", "X summary [] total d0 s0 c0 r0 w0 n0",
                            "X globalAux none", "X end"));
}

}  // namespace
