#include "base/HTOutputFile.h"

#include <atomic>
#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <pthread.h>
#include <sys/stat.h>
#include <unistd.h>

namespace {

std::string errorFor(int error) { return std::strerror(error); }

// The temporary files being written, for a signal that ends the program to
// remove. Reports are written one at a time, snapfiles one per gathering
// thread: a slot is taken while a file is open and freed when it is done.
constexpr int kPendingSlots = 64;
constexpr size_t kPendingPathLength = 4096;
char pendingTemporaries[kPendingSlots][kPendingPathLength];
std::atomic<bool> slotTaken[kPendingSlots];

void removePendingAndDie(int signal)
{
    for (auto& pending : pendingTemporaries)
        if (pending[0] != '\0') ::unlink(pending);
    ::signal(signal, SIG_DFL);
    ::raise(signal);
}

constexpr int kFatalSignals[] = {SIGINT, SIGTERM, SIGHUP};

// Signals that end the program at once (Ctrl-C on a terminal, kill, a
// closed terminal) first remove the temporary file. Signals the program
// handles or ignores otherwise are left alone.
void removeTemporaryOnFatalSignals()
{
    for (int signal : kFatalSignals) {
        struct sigaction current {};
        if (::sigaction(signal, nullptr, &current) != 0 || current.sa_handler != SIG_DFL) continue;
        struct sigaction handler {};
        handler.sa_handler = removePendingAndDie;
        ::sigemptyset(&handler.sa_mask);
        ::sigaction(signal, &handler, nullptr);
    }
}

void forgetTemporary(int slot)
{
    if (slot < 0) return;
    pendingTemporaries[slot][0] = '\0';
    slotTaken[slot].store(false);
}

// Creates the temporary file from `pattern` with those signals held back,
// so that none can end the program between the file's creation and its
// name being recorded for removal; `slot` is where it was recorded (-1
// when every slot was taken or the name is too long).
int createTemporary(std::string& pattern, int& slot)
{
    slot = -1;
    removeTemporaryOnFatalSignals();
    sigset_t fatal;
    sigset_t previous;
    ::sigemptyset(&fatal);
    for (int signal : kFatalSignals) ::sigaddset(&fatal, signal);
    ::pthread_sigmask(SIG_BLOCK, &fatal, &previous);
    int fd = ::mkostemp(pattern.data(), O_CLOEXEC);
    for (int i = 0; fd >= 0 && pattern.size() < kPendingPathLength && i < kPendingSlots; ++i) {
        if (slotTaken[i].exchange(true)) continue;
        std::memcpy(pendingTemporaries[i], pattern.c_str(), pattern.size() + 1);
        slot = i;
        break;
    }
    const int error = errno;
    ::pthread_sigmask(SIG_SETMASK, &previous, nullptr);
    errno = error;
    return fd;
}

// The permissions a newly created file gets from the process's umask.
mode_t newFileMode()
{
    mode_t mask = ::umask(0);
    ::umask(mask);
    return 0666 & ~mask;
}

}  // namespace

HTOutputFile::HTOutputFile(std::string path, std::string temporaryPath, std::FILE* stream, int slot)
    : path_(std::move(path)), temporaryPath_(std::move(temporaryPath)), stream_(stream), slot_(slot)
{
}

std::unique_ptr<HTOutputFile> HTOutputFile::open(const std::string& path, std::string* errorText)
{
    struct stat existing {};
    const bool exists = ::stat(path.c_str(), &existing) == 0;
    if (exists && S_ISDIR(existing.st_mode)) {
        *errorText = errorFor(EISDIR);
        return nullptr;
    }
    if (exists && !S_ISREG(existing.st_mode)) {
        std::FILE* stream = std::fopen(path.c_str(), "w");
        if (stream == nullptr) {
            *errorText = errorFor(errno);
            return nullptr;
        }
        return std::unique_ptr<HTOutputFile>(new HTOutputFile(path, "", stream, -1));
    }
    // A file heft may not write keeps its content, as a plain open would.
    if (exists && ::access(path.c_str(), W_OK) != 0) {
        *errorText = errorFor(errno);
        return nullptr;
    }
    std::string temporary = path + ".XXXXXX";
    int slot = -1;
    int fd = createTemporary(temporary, slot);
    if (fd < 0) {
        *errorText = errorFor(errno);
        return nullptr;
    }
    (void)::fchmod(fd, exists ? existing.st_mode & 07777 : newFileMode());
    std::FILE* stream = ::fdopen(fd, "w");
    if (stream == nullptr) {
        *errorText = errorFor(errno);
        ::close(fd);
        ::unlink(temporary.c_str());
        forgetTemporary(slot);
        return nullptr;
    }
    return std::unique_ptr<HTOutputFile>(new HTOutputFile(path, std::move(temporary), stream, slot));
}

std::optional<std::string> HTOutputFile::directoryProblem(const std::string& directory)
{
    struct stat status {};
    if (::stat(directory.c_str(), &status) != 0) return errorFor(errno);
    if (!S_ISDIR(status.st_mode)) return errorFor(ENOTDIR);
    if (::access(directory.c_str(), W_OK | X_OK) != 0) return errorFor(errno);
    return std::nullopt;
}

HTOutputFile::~HTOutputFile()
{
    if (stream_ == nullptr) return;
    std::fclose(stream_);
    if (!temporaryPath_.empty()) ::unlink(temporaryPath_.c_str());
    forgetTemporary(slot_);
}

bool HTOutputFile::commit(std::string* errorText)
{
    std::FILE* stream = stream_;
    stream_ = nullptr;
    // A failed write leaves the stream's error flag set; the close writes
    // what is still buffered.
    errno = 0;
    const bool written = std::fflush(stream) == 0 && !std::ferror(stream);
    int error = errno != 0 ? errno : EIO;
    const bool closed = std::fclose(stream) == 0;
    if (written && !closed) error = errno;
    bool ok = written && closed;
    if (ok && !temporaryPath_.empty() && ::rename(temporaryPath_.c_str(), path_.c_str()) != 0) {
        error = errno;
        ok = false;
    }
    if (!ok) {
        if (!temporaryPath_.empty()) ::unlink(temporaryPath_.c_str());
        *errorText = errorFor(error);
    }
    forgetTemporary(slot_);
    return ok;
}
