// Running the built heft on live processes, the kernel's own figures for them, and reading heft's JSON report.

#pragma once

#include "support/HTLayoutChild.h"

#include <sys/file.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/swap.h>

#include <gmock/gmock.h>
#include <rapidjson/document.h>

#include <algorithm>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <optional>
#include <set>

namespace heft_e2e {

inline constexpr const char* kHeftBinary = HEFT_BINARY;
inline constexpr const char* kSetpriv = "/usr/bin/setpriv";
inline constexpr uint64_t kMiB = 1024 * 1024;
inline constexpr const char* kUntagged = "untagged (\"VM_ALLOCATE\")";

inline std::string readFile(const std::string& path)
{
    return {std::istreambuf_iterator<char>(std::ifstream(path).rdbuf()), std::istreambuf_iterator<char>()};
}

inline std::string n(uint64_t value) { return std::to_string(value); }

MATCHER_P(HoldsOnce, text, "holds \"" + std::string(text) + "\" once")
{
    size_t first = arg.find(text);
    return first != std::string::npos && arg.find(text, first + 1) == std::string::npos;
}

struct Outcome {
    int status = -1;  // the exit status, or -1 when the program did not exit normally
    std::string standardOutput, standardError;
};

// Runs `program`, output to memory files (which never stall it as pipes may), stopped by an alarm if it hangs.
inline Outcome runProgram(const char* program, std::vector<std::string> arguments, rlim_t openFiles = 0)
{
    const int streams[2] = {memfd_create("heft-e2e-out", MFD_CLOEXEC), memfd_create("heft-e2e-err", MFD_CLOEXEC)};
    std::vector<char*> argv(arguments.size() + 1);
    std::ranges::transform(arguments, argv.begin(), [](auto& argument) { return argument.data(); });
    pid_t child = fork();
    if (child == 0) {
        dup2(streams[0], STDOUT_FILENO);
        dup2(streams[1], STDERR_FILENO);
        const rlimit files{openFiles, openFiles};
        close_range(3, ~0U, 0);
        if (openFiles != 0 && setrlimit(RLIMIT_NOFILE, &files) != 0) _exit(126);
        alarm(180);
        execv(program, argv.data());
        _exit(127);
    }
    int status = 0;
    while (child > 0 && waitpid(child, &status, 0) < 0 && errno == EINTR) {}
    EXPECT_FALSE(WIFSIGNALED(status) && WTERMSIG(status) == SIGALRM) << arguments[0] << " hung";
    Outcome outcome{child > 0 && WIFEXITED(status) ? WEXITSTATUS(status) : -1,
                    readFile("/proc/self/fd/" + std::to_string(streams[0])),
                    readFile("/proc/self/fd/" + std::to_string(streams[1]))};
    for (int fd : streams) close(fd);
    return outcome;
}

inline Outcome runHeft(std::vector<std::string> arguments)
{
    arguments.insert(arguments.begin(), "heft");
    return runProgram(kHeftBinary, std::move(arguments));
}

inline Outcome runHeftAsNobody(std::vector<std::string> arguments)
{
    arguments.insert(arguments.begin(), {"setpriv", "--reuid=65534", "--regid=65534", "--clear-groups", kHeftBinary});
    return runProgram(kSetpriv, std::move(arguments));
}

// Why the user nobody may not run heft and the layout program (as under a private directory); empty if it may.
inline std::string whyNobodyCannotRun()
{
    if (geteuid() != 0) return "running heft as another user needs root";
    if (access(kSetpriv, X_OK) != 0) return std::string(kSetpriv) + " is needed to change the user";
    struct stat info {};
    for (const std::string path : {kHeftBinary, HEFT_LAYOUT_PROGRAM})
        for (size_t end = 0; end != std::string::npos;)
            if (stat(path.substr(0, end = path.find('/', end + 1)).c_str(), &info) != 0 || !(info.st_mode & S_IXOTH))
                return "the user nobody may not run " + path;
    return "";
}

// A directory under /tmp, removed with everything in it.
struct TempDir {
    TempDir() = default;
    TempDir(const TempDir&) = delete;
    ~TempDir() { std::filesystem::remove_all(path, ignored); }

    std::string file(const char* name) const { return path + "/" + name; }
    size_t entries() const { return std::distance(std::filesystem::directory_iterator(path), {}); }

    std::string pattern = "/tmp/heft-e2e-XXXXXX", path = mkdtemp(pattern.data()) ? pattern : "";
    std::error_code ignored;
};

// The system's swap if any (listed after the heading of /proc/swaps), else a swap file that goes with this object.
// Tests that use swap take turns (a lock on a file): one test's swapoff would bring another's pages back.
struct SwapArea {
    SwapArea()
    {
        if (lock_ >= 0) flock(lock_, LOCK_EX);
        std::string swaps = readFile("/proc/swaps");
        if ((available = swaps.find('\n') + 1 < swaps.size())) return;
        Outcome made = runProgram("/bin/sh",
                                  {"sh", "-ec",
                                   "f=$(mktemp /tmp/heft-e2e-swap-XXXXXX); echo \"$f\"\n"
                                   "fallocate -l 256M \"$f\"; mkswap \"$f\" >&2; swapon \"$f\""});
        path_ = made.standardOutput.substr(0, made.standardOutput.find('\n'));
        enabled_ = available = made.status == 0;
        reason = made.standardError;
    }
    ~SwapArea()
    {
        if (enabled_ && swapoff(path_.c_str()) != 0) ADD_FAILURE() << "swapoff " << path_ << ": " << strerror(errno);
        if (!path_.empty()) unlink(path_.c_str());
        if (lock_ >= 0) close(lock_);
    }

    int lock_ = open("/tmp/heft-e2e-swap.lock", O_RDWR | O_CREAT | O_CLOEXEC, 0600);
    std::string path_, reason;
    bool enabled_ = false, available = false;
};

// A "Name:  123 kB" field of a /proc file's text, in bytes; 0 when absent.
inline uint64_t kernelField(const std::string& text, const char* name)
{
    size_t at = text.find("\n" + std::string(name) + ":");
    return at == std::string::npos ? 0 : std::strtoull(text.c_str() + at + std::strlen(name) + 2, nullptr, 10) * 1024;
}

// The smaps entry of the mapping of `pid` that starts at `address`.
inline std::string mappingAt(pid_t pid, uint64_t address)
{
    std::string smaps = "\n" + readFile("/proc/" + std::to_string(pid) + "/smaps");
    char heading[32];
    std::snprintf(heading, sizeof(heading), "\n%llx-", static_cast<unsigned long long>(address));
    size_t start = smaps.find(heading);
    size_t end = start == std::string::npos ? start : smaps.find("\nVmFlags:", start);
    return end == std::string::npos ? std::string() : smaps.substr(start, end - start);
}

// The written and swapped pages and page tables of `pid`, shared pages divided among their mappers if
// `proportionally`; read through `thread` if any (once the main thread has exited).
inline uint64_t kernelHeft(pid_t pid, bool proportionally = false, pid_t thread = 0)
{
    std::string base = "/proc/" + std::to_string(pid) + (thread ? "/task/" + std::to_string(thread) : "");
    std::string rollup = readFile(base + "/smaps_rollup"), status = readFile(base + "/status");
    EXPECT_FALSE(rollup.empty() || status.empty()) << "cannot read the memory figures of " << pid;
    uint64_t pages = proportionally
        ? kernelField(rollup, "Pss_Dirty") + kernelField(rollup, "SwapPss")
        : kernelField(rollup, "Private_Dirty") + kernelField(rollup, "Shared_Dirty") + kernelField(rollup, "Swap");
    return pages + kernelField(status, "VmPTE");
}

inline bool between(uint64_t value, uint64_t least, uint64_t most) { return least <= value && value <= most; }

inline bool loadReport(const std::string& path, rapidjson::Document& document)
{
    std::string text = readFile(path);
    const bool loaded = !document.Parse(text.c_str()).HasParseError() && document.IsObject();
    EXPECT_TRUE(loaded) << "no JSON report at " << path << ": " << text.substr(0, 200);
    return loaded;
}

inline const rapidjson::Value* member(const rapidjson::Value* object, const char* key)
{
    return object && object->IsObject() && object->HasMember(key) ? &(*object)[key] : nullptr;
}

inline uint64_t number(const rapidjson::Value* object, const char* key)
{
    return member(object, key) && member(object, key)->IsUint64() ? member(object, key)->GetUint64() : 0;
}

inline std::string nameOf(const rapidjson::Value* object)
{
    return member(object, "name") && member(object, "name")->IsString() ? member(object, "name")->GetString() : "";
}

// A figure of a category of a process's own memory or a shared table.
inline uint64_t figure(const rapidjson::Value* owner, const std::string& category, const char* key)
{
    return number(member(member(owner, "categories"), category.c_str()), key);
}

inline auto arrayIn(const rapidjson::Value* object, const char* key)
{
    static const rapidjson::Value empty(rapidjson::kArrayType);
    const rapidjson::Value* array = member(object, key);
    return (array && array->IsArray() ? *array : empty).GetArray();
}

inline const rapidjson::Value* processIn(const rapidjson::Value& report, pid_t pid)
{
    for (const auto& process : arrayIn(&report, "processes"))
        if (number(&process, "pid") == static_cast<uint64_t>(pid)) return &process;
    return nullptr;
}

// The region of `process` (listed with -v) that holds `address`.
inline const rapidjson::Value* regionAt(const rapidjson::Value* process, uint64_t address)
{
    for (const auto& region : arrayIn(process, "regions"))
        if (uint64_t start = number(&region, "addr"); start <= address && address < start + number(&region, "vsize"))
            return &region;
    ADD_FAILURE() << "no region holds " << std::hex << address;
    return nullptr;
}

inline std::set<int> pidsOf(const rapidjson::Value& shared)
{
    std::set<int> pids;
    for (const auto& pid : arrayIn(&shared, "pids")) pids.insert(pid.GetInt());
    return pids;
}

// The table common to exactly `pids`; null when there is none.
inline const rapidjson::Value* sharedBy(const rapidjson::Value& report, const std::set<int>& pids)
{
    for (const auto& shared : arrayIn(&report, "shared"))
        if (!shared.HasMember("specific_to_pid") && pidsOf(shared) == pids) return &shared;
    return nullptr;
}

// A blocked process's heft is exactly the kernel's figure read after, but for up to `cleanedSince` written back.
inline void expectHeftMatchesKernel(const rapidjson::Value& report, pid_t pid, uint64_t cleanedSince = 0,
                                    pid_t thread = 0)
{
    uint64_t kernel = kernelHeft(pid, false, thread);
    EXPECT_PRED3(between, number(processIn(report, pid), "heft"), kernel, kernel + cleanedSince) << "pid " << pid;
}

class HTE2EReportTest : public testing::Test {
protected:
    void SetUp() override { ASSERT_FALSE(directory_.path.empty()) << "mkdtemp: " << std::strerror(errno); }

    // Lays out child_ and reports on it in bytes, every region, as text_ and report_; false if either fails.
    bool layOutAndMeasure(std::vector<std::string> directives, std::vector<std::string> arguments = {})
    {
        child_.emplace(std::move(directives));
        if (!child_->ready()) return false;
        std::string path = directory_.file("report.json");
        unlink(path.c_str());
        arguments.insert(arguments.begin(), {"-v", "-w", "-f", "bytes", "-j", path});
        arguments.push_back(child_->pidString());
        text_ = runHeft(arguments);
        EXPECT_EQ(text_.status, 0) << text_.standardError;
        return loadReport(path, report_);
    }

    TempDir directory_;
    std::optional<HTLayoutChild> child_;
    rapidjson::Document report_;
    Outcome text_;
};

}  // namespace heft_e2e
