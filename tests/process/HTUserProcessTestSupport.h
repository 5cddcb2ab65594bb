#pragma once

#include "base/HTNoticeLog.h"
#include "model/HTMemoryRegion.h"
#include "platform/fake/HTFakePlatform.h"
#include "process/HTUserProcess.h"

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

inline constexpr uint64_t kPage = 4096;
inline constexpr int32_t kPid = 500;

// Opens up what the tests reset between runs.
class HTUserProcessProbe : public HTUserProcess {
public:
    using HTUserProcess::_forgetLedgerTemplate;
    using HTUserProcess::_forgetOutOfDescriptors;
};

// A live process that maps the shared library cache of a 64-bit ARM system:
// the one way to drive the shared-cache code with live-process answers.
class HTMachUserProcess : public HTUserProcess {
public:
    using HTUserProcess::HTUserProcess;

protected:
    int _platformCode() override { return 3; }
};

// Processes scripted on a fake platform. The breakdown switch, the sharing
// switch, the ledger template, the global errors, whether running out of
// descriptors was said and the notices for standard error are program-wide,
// so every test starts and ends with them in their default state.
class HTUserProcessTest : public ::testing::Test {
protected:
    HTUserProcessTest() : platform_(std::make_shared<HTFakePlatform>())
    {
        HTUserProcessProbe::_forgetLedgerTemplate();
        HTUserProcessProbe::_forgetOutOfDescriptors();
        HTNoticeLog::standardError().take();
        setBreakdown(false);
    }
    ~HTUserProcessTest() override
    {
        HTProcess::_clearGlobalErrors();
        HTNoticeLog::standardError().take();
        HTUserProcessProbe::_forgetLedgerTemplate();
        HTUserProcessProbe::_forgetOutOfDescriptors();
    }

    // The settings of the processes made from here on.
    void setBreakdown(bool on) { settings_.breakDownPhysHeft = on; }

    // The scripted process "target" under kPid.
    HTFakePlatform::Process& target() { return *platform_->process(kPid); }
    HTFakePlatform::Process& addTarget() { return platform_->addProcess(kPid, 1, "target"); }

    template<typename Process = HTUserProcess>
    std::shared_ptr<Process> created()
    {
        auto process = std::make_shared<Process>(platform_);
        process->setSettings(settings_);
        EXPECT_TRUE(process->initWithBsdInfo(target().info));
        return process;
    }

    template<typename Process = HTUserProcess>
    std::shared_ptr<Process> gathered()
    {
        auto process = created<Process>();
        process->gatherData();
        return process;
    }

    // Private anonymous read-write memory of `pages` pages, nothing resident.
    static HTFakePlatform::Region anonymous(uint64_t start, uint64_t pages, uint64_t objectId = 0)
    {
        HTFakePlatform::Region region;
        region.start = start;
        region.size = pages * kPage;
        region.info.protection = VM_PROT_READ | VM_PROT_WRITE;
        region.info.max_protection = VM_PROT_READ | VM_PROT_WRITE | VM_PROT_EXECUTE;
        region.info.share_mode = SM_PRIVATE;
        region.info.object_id_full = objectId != 0 ? objectId : 0x4000000000000000 | start;
        region.info.object_id = static_cast<uint32_t>(region.info.object_id_full);
        return region;
    }

    // The notices for standard error so far; the log is emptied.
    static std::vector<std::string> takeNotices() { return HTNoticeLog::standardError().take(); }

    std::shared_ptr<HTFakePlatform> platform_;
    HTSettings settings_;
};
