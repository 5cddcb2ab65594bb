// Processes read from a scripted kernel, and everything each read gave,
// compared with expected files: see tests/data/reports/processes/README.md.

#include "base/HTNoticeLog.h"
#include "model/HTAuxData.h"
#include "model/HTAuxDataMap.h"
#include "model/HTMemoryRegion.h"
#include "output/HTExpectedReport.h"
#include "platform/fake/HTFakePlatform.h"
#include "process/HTCorpseProcess.h"
#include "process/HTKernelProcess.h"
#include "process/HTKernelScript.h"
#include "process/HTSnapfileProcess.h"
#include "process/HTUserProcess.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <map>
#include <optional>
#include <sstream>
#include <string>
#include <vector>

namespace {

const std::string kScenarios = std::string(HEFT_TEST_DATA_DIR) + "/reports/processes/";

// A process that may map the shared library cache of a 64-bit ARM system:
// the one way to drive the shared-cache code with live-process answers.
class HTScenarioProcess : public HTUserProcess {
public:
    HTScenarioProcess(std::shared_ptr<HTPlatform> platform, std::optional<int> platformCode)
        : HTUserProcess(std::move(platform)), platformCode_(platformCode)
    {
    }
    // What one run remembers: the ledger template, and whether running out
    // of descriptors was said.
    using HTUserProcess::_forgetLedgerTemplate;
    using HTUserProcess::_forgetOutOfDescriptors;

protected:
    int _platformCode() override { return platformCode_.value_or(HTUserProcess::_platformCode()); }

private:
    std::optional<int> platformCode_;
};

// clang-format off
const std::map<std::string, int64_t> kNames = {{"private", SM_PRIVATE}, {"cow", SM_COW}, {"shared", SM_SHARED},
    {"volatile", VM_PURGABLE_VOLATILE}, {"nonvolatile", VM_PURGABLE_NONVOLATILE}, {"empty", VM_PURGABLE_EMPTY},
    {"run", SRUN}, {"zombie", SZOMB}, {"lp64", PROC_FLAG_LP64}, {"inexit", PROC_FLAG_LP64 | PROC_FLAG_INEXIT},
    {"gone", MACH_SEND_INVALID_DEST}, {"failure", KERN_FAILURE}, {"emfile", HT_KERN_ERRNO_BASE | EMFILE},
    {"enfile", HT_KERN_ERRNO_BASE | ENFILE}, {"eperm", EPERM}, {"fake", HTFakeRegionTag}, {"system", PROC_FLAG_SYSTEM}};
// clang-format on

// A number, or one of the names above.
int64_t valueOf(const std::string& text)
{
    auto named = kNames.find(text);
    return named != kNames.end() ? named->second : std::stoll(text, nullptr, 0);
}

// "a,b,c" as numbers.
std::vector<int64_t> listOf(const std::string& text)
{
    std::vector<int64_t> values;
    std::istringstream list(text);
    for (std::string item; std::getline(list, item, ',');) values.push_back(valueOf(item));
    return values;
}

// A page's disposition: p present, d dirty, o paged out, r reusable,
// e external, - none.
int32_t disposition(const std::string& letters)
{
    const std::map<char, int32_t> bits = {{'p', VM_PAGE_QUERY_PAGE_PRESENT},
                                          {'d', VM_PAGE_QUERY_PAGE_DIRTY},
                                          {'o', VM_PAGE_QUERY_PAGE_PAGED_OUT},
                                          {'r', VM_PAGE_QUERY_PAGE_REUSABLE},
                                          {'e', VM_PAGE_QUERY_PAGE_EXTERNAL}};
    int32_t kind = 0;
    for (char letter : letters) kind |= bits.count(letter) ? bits.at(letter) : 0;
    return kind;
}

std::string hex(uint64_t value)
{
    std::ostringstream out;
    out << "0x" << std::hex << value;
    return out.str();
}

class HTUserProcessScenarioTest : public ::testing::Test {
protected:
    ~HTUserProcessScenarioTest() override { forgetRun(); }

    static void forgetRun()
    {
        HTScenarioProcess::_forgetLedgerTemplate();
        HTScenarioProcess::_forgetOutOfDescriptors();
        HTProcess::_clearGlobalErrors();
        HTNoticeLog::standardError().take();
    }

    // Runs the scenario; returns what its reads gave.
    std::string run(const std::string& path)
    {
        forgetRun();
        platform_ = std::make_shared<HTFakePlatform>();
        settings_ = HTSettings{.breakDownPhysHeft = false};
        platformCode_.reset();
        std::ostringstream out;
        std::istringstream lines(contentsOf(path));
        for (std::string raw; std::getline(lines, raw);) {
            const HTScenarioLine line(raw);
            if (line.kind == "set") set(line);
            if (line.kind == "template") {
                HTScenarioProcess::_forgetLedgerTemplate();
                platform_->ledgerTemplate.reset();
                if (line.argument != "none") {
                    std::istringstream names(line.argument);
                    platform_->ledgerTemplate.emplace();
                    for (std::string name; std::getline(names, name, ',');) platform_->ledgerTemplate->push_back(name);
                }
            }
            if (line.kind == "realpath") platform_->realpaths[line.argument] = *line.text("to");
            if (line.kind == "process") scriptProcess(line);
            if (line.kind == "region") target_->regions.push_back(region(line));
            if (line.kind == "pages") scriptPages(line);
            if (line.kind == "owned-object") {
                if (!target_->ownedVmObjects) target_->ownedVmObjects.emplace();
                auto size = [&](const char* key) { return line.number(key) * platform_->pageSize; };
                target_->ownedVmObjects->push_back({line.number("id"), size("virtual"), size("resident"), size("wired"),
                                                    size("reusable"), size("compressed"), line.number("flags")});
            }
            if (line.kind == "image") {
                HTPlatformImage image{line.argument, 0, {}};
                for (auto [at, end] = line.fields.equal_range("segment"); at != end; ++at) {
                    std::istringstream parts(at->second);
                    std::string name, start, size;
                    std::getline(std::getline(std::getline(parts, name, ':'), start, ':'), size);
                    image.segments.push_back({name, std::stoull(start, nullptr, 0), std::stoull(size, nullptr, 0)});
                }
                image.baseAddress = image.segments.front().start;
                target_->images.push_back(image);
            }
            if (line.kind == "gather") gather(line, out);
            if (line.kind == "snapfile") readSnapfile(line.argument, out);
            scriptKernel(*platform_, line);
        }
        return out.str();
    }

    void set(const HTScenarioLine& line)
    {
        settings_.breakDownPhysHeft = line.number("breakdown", settings_.breakDownPhysHeft);
        settings_.sharingAnalysisDisabled = line.number("nosharing", settings_.sharingAnalysisDisabled);
        if (line.text("platform")) platformCode_ = static_cast<int>(valueOf(*line.text("platform")));
        platform_->pageSize = line.number("pagesize", platform_->pageSize);
        platform_->uniformRuns = line.number("uniform", platform_->uniformRuns);
    }

    // Adds the process, or changes it when it is there already.
    void scriptProcess(const HTScenarioLine& line)
    {
        const int32_t pid = std::stoi(line.argument);
        target_ = platform_->process(pid);
        if (!target_) target_ = &platform_->addProcess(pid, 1, line.text("name").value_or("target"));
        HTFakePlatform::Process& p = *target_;
        for (const auto& [key, value] : line.fields) {
            if (key == "status") p.info.pbi_status = static_cast<uint32_t>(valueOf(value));
            if (key == "flags") p.info.pbi_flags = static_cast<uint32_t>(valueOf(value));
            if (key == "task") p.taskResult = static_cast<kern_return_t>(valueOf(value));
            if (key == "rusage")
                p.rusage =
                    rusage_info_v4{listOf(value)[0] * platform_->pageSize, listOf(value)[1] * platform_->pageSize};
            if (key == "ledger") p.ledgerBalances = listOf(value);
            if (key == "ledger-errno") p.ledgerErrno = static_cast<int>(valueOf(value));
            if (key == "owned") p.ownedVmObjects.emplace();
            if (key == "owned-errno") p.ownedVmObjectsErrno = static_cast<int>(valueOf(value));
            if (key == "owned-hint") p.ownedVmObjectsLengthHint = valueOf(value);
            if (key == "fail-region") p.regionFailureIndex = valueOf(value);
            if (key == "fail-code") p.regionFailureCode = static_cast<kern_return_t>(valueOf(value));
            if (key == "fail-page") p.pageQueryFailureAddress = valueOf(value);
            if (key == "exited") p.exited = valueOf(value);
        }
    }

    // Private anonymous read-write memory unless the line says otherwise;
    // sizes in pages.
    HTFakePlatform::Region region(const HTScenarioLine& line) const
    {
        HTFakePlatform::Region r;
        vm_region_submap_info_64& info = r.info;
        r.start = line.number("start");
        r.size = line.number("pages") * platform_->pageSize;
        info.protection = static_cast<int32_t>(line.number("prot", VM_PROT_READ | VM_PROT_WRITE));
        info.max_protection = static_cast<int32_t>(line.number("max", VM_PROT_READ | VM_PROT_WRITE | VM_PROT_EXECUTE));
        info.share_mode = static_cast<uint8_t>(valueOf(line.text("share").value_or("private")));
        info.object_id_full = line.number("object", 0x4000000000000000 | r.start);
        info.object_id = static_cast<uint32_t>(line.number("object32", info.object_id_full));
        info.offset = line.number("offset");
        info.user_tag = static_cast<uint32_t>(valueOf(line.text("tag").value_or("0")));
        info.user_wired_count = static_cast<uint16_t>(line.number("wired"));
        info.external_pager = static_cast<uint8_t>(line.number("pager"));
        info.pages_resident = static_cast<uint32_t>(line.number("resident"));
        info.pages_dirtied = static_cast<uint32_t>(line.number("dirtied"));
        info.pages_swapped_out = static_cast<uint32_t>(line.number("swapped"));
        info.pages_reusable = static_cast<uint32_t>(line.number("reusable"));
        r.infoCount = static_cast<uint32_t>(line.number("words", VM_REGION_SUBMAP_INFO_COUNT_64));
        r.path = line.text("path");
        if (auto purge = line.text("purge")) r.purgeState = static_cast<int32_t>(valueOf(*purge));
        return r;
    }

    // `pages A K,K*N,...`: the dispositions of the pages from A on.
    void scriptPages(const HTScenarioLine& line)
    {
        uint64_t address = std::stoull(line.argument, nullptr, 0);
        std::istringstream list(*line.text("kinds"));
        for (std::string item; std::getline(list, item, ',');) {
            const size_t star = item.find('*');
            const uint64_t count = star == std::string::npos ? 1 : std::stoull(item.substr(star + 1));
            const int32_t kind = disposition(item.substr(0, star));
            for (uint64_t i = 0; i < count; ++i, address += platform_->pageSize)
                if (kind) target_->dispositions[address] = kind;
        }
    }

    // Reads the process and writes down everything the read gave.
    void gather(const HTScenarioLine& line, std::ostringstream& out)
    {
        HTFakePlatform::Process& script = *platform_->process(static_cast<int32_t>(line.number("pid", 500)));
        platform_->pageQueries.clear();
        platform_->regionLookups = platform_->basicRegionLookups = 0;
        platform_->loadedModuleReads = platform_->kernelImageListOpens = 0;
        const bool kernel = script.info.pbi_flags & PROC_FLAG_SYSTEM;
        std::shared_ptr<HTProcess> process = std::make_shared<HTScenarioProcess>(platform_, platformCode_);
        if (kernel) process = std::make_shared<HTKernelProcess>(platform_);
        const int ownedQueries = platform_->ownedVmObjectQueries;
        process->setSettings(settings_);
        testing::internal::CaptureStderr();
        const bool created =
            line.text("corpse") ? createCorpse(process, line, script, out) : process->initWithBsdInfo(script.info);
        if (created) {
            process->setHiddenFromDisplay(line.number("hidden"));
            const bool exited = script.exited;
            script.exited = exited || line.number("exit");
            process->gatherData();
            script.exited = exited;
        }
        out << "gather " << process->displayString() << (created ? "" : ": not created") << "\n";
        if (created) describe(*process, out, kernel);
        describeMessages(out);
        if (kernel) {
            out << "calls: " << platform_->loadedModuleReads << " module lists, " << platform_->kernelImageListOpens
                << " symbol resolvers\n\n";
            return;
        }
        out << "calls: " << platform_->regionLookups << " region, " << platform_->basicRegionLookups << " basic, "
            << platform_->ledgerTemplateReads << " template, " << platform_->ownedVmObjectQueries - ownedQueries
            << " owned; queries";
        for (const auto& [address, size] : platform_->pageQueries) out << " " << hex(address) << "+" << hex(size);
        out << "\n\n";
    }

    // `gather corpse NAME procflags F dirty D ledgers A,B port 0`: the
    // scripted process read as a corpse, with the identity given.
    bool createCorpse(std::shared_ptr<HTProcess>& process, const HTScenarioLine& line, HTFakePlatform::Process& script,
                      std::ostringstream& out)
    {
        auto corpse = std::make_shared<HTCorpseProcess>(platform_);
        corpse->setSettings(process->settings());
        process = corpse;
        const auto flags = static_cast<uint32_t>(line.number("procflags"));
        out << "corpse record flags " << hex(HTCorpseProcess::recordFlagsForProcFlags(flags)) << "\n";
        const int32_t pid = static_cast<int32_t>(script.info.pbi_pid);
        if (!corpse->initWithCorpse(line.number("port", 1) ? platform_->corpsePort(pid) : nullptr, pid,
                                    *line.text("corpse"), static_cast<uint32_t>(line.number("dirty")), flags))
            return false;
        out << "corpse " << (corpse->is64bit() ? "64" : "32") << "-bit\n";
        const std::vector<int64_t> ledgers = listOf(line.text("ledgers").value_or(""));
        const std::vector<uint64_t> values(ledgers.begin(), ledgers.end());
        corpse->addLedgerData(values.data(), values.size());
        return true;
    }

    // A snapfile of tests/data/snapfiles, read as a process.
    void readSnapfile(const std::string& name, std::ostringstream& out)
    {
        HTError error;
        testing::internal::CaptureStderr();
        auto process = HTSnapfileProcess::processWithSnapfile(
            platform_, settings_, std::string(HEFT_TEST_DATA_DIR) + "/snapfiles/" + name, &error);
        if (process) process->gatherData();
        out << "snapfile " << name << ": "
            << (process ? process->displayString()
                        : "not created: " + error.domain + " " + std::to_string(error.code) + " " +
                        error.description.value_or(""))
            << "\n";
        if (process) describe(*process, out, false);
        describeMessages(out);
        out << "\n";
    }

    // What was said on the side, since capturing standard error began.
    static void describeMessages(std::ostringstream& out)
    {
        const std::string told = testing::internal::GetCapturedStderr();
        for (const std::string& text : HTNoticeLog::standardError().take()) out << "notice " << text << "\n";
        for (const std::string& text : HTProcess::globalErrors()) out << "global-error " << text << "\n";
        HTProcess::_clearGlobalErrors();
        std::istringstream toldLines(told);
        for (std::string text; std::getline(toldLines, text);) out << "stderr " << text << "\n";
    }

    // Auxiliary data, a nested map's keys after its own.
    static void describeAux(const HTAuxDataMap& data, const std::string& prefix, std::ostringstream& out)
    {
        for (const auto& [key, value] : data) {
            if (auto map = std::dynamic_pointer_cast<HTAuxDataMap>(value)) {
                out << "aux " << prefix << key << " map\n";
                describeAux(*map, prefix + key + "/", out);
                continue;
            }
            auto datum = std::dynamic_pointer_cast<HTAuxData>(value);
            out << "aux " << prefix << key << " " << datum->value() << (datum->shouldAggregate() ? "" : " alone")
                << "\n";
        }
    }

    // The kernel's regions tell their record's index.
    static void describe(HTProcess& process, std::ostringstream& out, bool kernel)
    {
        out << "idle-exit " << process.idleExitStatus() << "\n";
        if (auto data = process.auxData()) describeAux(*data, "", out);
        if (!process.hasMemoryRegions()) out << "no regions read\n";
        for (const auto& r : process.memoryRegions()) {
            out << "region " << (r->start() == HTNoAddress ? "none" : hex(r->start())) << " size " << hex(r->size())
                << " object " << hex(r->object_id()) << " offset " << hex(r->offset()) << " share "
                << int(r->share_mode()) << " segment " << int(r->segment()) << " "
                << std::quoted(r->name().value_or(""));
            if (r->detailedName()) out << " " << std::quoted(*r->detailedName());
            out << (r->wired() ? " wired" : "") << (r->ownedExclusivelyByParentProcess() ? " owned" : "")
                << (r->isFake() ? " unmapped" : "") << (r->inSharedCache() ? " cache" : "")
                << (r->unusedSharedCacheRegion() ? " unused" : "");
            if (kernel) out << " tag " << r->user_tag();
            out << "\n  dirty " << r->dirtySize() << " swapped " << r->swappedSize() << " clean "
                << r->cleanNonSpecSize() << " reclaimable " << r->reclaimableSize() << "\n";
            if (r->subrangeList())
                for (const HTRangeListNode* n = r->subrangeList()->head(); n; n = n->next)
                    out << "  run " << hex(n->start) << "+" << hex(n->size) << " dirty " << n->dirty << " swapped "
                        << n->swapped << " clean " << n->clean << " reclaimable " << n->reclaimable << " wired "
                        << n->wired << "\n";
            if (const HTSharedPageList* list = r->sharedPageList())
                for (const HTSharedPageList::Run& run : list->runs())
                    out << "  pages " << run.firstPage << "+" << run.count << " kind " << int(run.kind) << " identity "
                        << (run.firstIdentity == HTSharedPageList::kNoIdentity ? 0 : list->identity(run, 0)) << "\n";
        }
        for (const std::string& text : process.warnings()) out << "warning " << text << "\n";
        for (const std::string& text : process.errors()) out << "error " << text << "\n";
    }

    std::shared_ptr<HTFakePlatform> platform_;
    HTFakePlatform::Process* target_ = nullptr;
    HTSettings settings_;
    std::optional<int> platformCode_;
};

TEST_F(HTUserProcessScenarioTest, Scenarios)
{
    std::vector<std::string> names;
    for (const auto& entry : std::filesystem::directory_iterator(kScenarios))
        if (entry.path().extension() == ".scenario") names.push_back(entry.path().stem());
    EXPECT_GE(names.size(), 10u);
    for (const std::string& name : names) {
        SCOPED_TRACE(name);
        expectReport("processes/" + name + ".txt", run(kScenarios + name + ".scenario"));
    }
}

TEST(HTSnapfileProcessTest, PlatformCodeFromTheDescription)
{
    const std::pair<const char*, int> rows[] = {
        {"Linux 6.1.0 x86_64", 5}, {"Linux ARM64", 5}, {"X86-64 (X86)", 1}, {"X86", 0},   {"ARM64", 3},
        {"ARM64-32", 4},           {"ARM64e", 3},      {"ARM64-3", 3},      {"ARMv7", 2}, {"PDP-11", -1}};
    for (const auto& [description, code] : rows)
        EXPECT_EQ(HTSnapfileProcess::platformCodeForDescription(description), code) << description;
}

}  // namespace
