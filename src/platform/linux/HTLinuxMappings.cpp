#include "platform/linux/HTLinuxMappings.h"

#include "platform/linux/HTFileDescriptor.h"
#include "platform/linux/HTLinuxRegionInfo.h"
#include "platform/linux/HTLinuxTaskPort.h"
#include "platform/linux/HTLiveThread.h"
#include "platform/linux/HTProcBuffer.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <unistd.h>

uint64_t htKernelPageSize()
{
    static const uint64_t pageSize = static_cast<uint64_t>(::sysconf(_SC_PAGESIZE));
    return pageSize;
}

kern_return_t HTLinuxMappings::openTask(int32_t pid, std::shared_ptr<HTTaskPort>* task)
{
    // The kernel is not a process with an address space of its own.
    if (pid <= 0 || task == nullptr) return KERN_INVALID_ARGUMENT;

    // The handle learns the process's start time here, and closes its
    // directory again before it is handed out.
    auto handle = std::make_shared<HTLinuxTaskPort>(pid);
    HTLinuxTaskPort::DirectoryUse directory(*handle);
    if (directory.fd() < 0) return HT_KERN_ERRNO_BASE | errno;
    // Opening smaps runs the kernel's ptrace read check: the same right
    // every later read of the process's memory needs.
    HTFileDescriptor smaps(::openat(directory.fd(), "smaps", O_RDONLY | O_CLOEXEC));
    if (!smaps.isOpen()) return HT_KERN_ERRNO_BASE | (errno == ENOENT ? ESRCH : errno);
    *task = std::move(handle);
    return KERN_SUCCESS;
}

kern_return_t HTLinuxMappings::loadVmas(HTLinuxTaskPort& task, bool refresh)
{
    if (!refresh && task.hasParsedVmas()) return KERN_SUCCESS;
    // Reused by every walk on this thread; it keeps the size of the largest
    // smaps read so far (megabytes for a big process).
    thread_local HTProcBuffer smaps;
    HTLinuxTaskPort::DirectoryUse directory(task);
    // Once a new read fails, what was read before no longer describes the
    // process.
    if (directory.fd() < 0 || !smaps.readFile(directory.fd(), "smaps")) {
        int error = errno;
        task.clearVmas();
        return htMeansGone(error) ? MACH_SEND_INVALID_DEST : HT_KERN_ERRNO_BASE | error;
    }
    // A process that dies while its smaps is read ends the text early,
    // without an error, and a zombie's reads empty: either way the text
    // does not describe the whole process. The thread asked is the one
    // whose smaps was read: a live one, when the main thread has exited.
    if (htThreadHasExited(directory.fd())) {
        task.clearVmas();
        return MACH_SEND_INVALID_DEST;
    }
    task.parseVmas(smaps.view());
    return KERN_SUCCESS;
}

kern_return_t HTLinuxMappings::vmaAtOrAbove(HTTaskPort& task, uint64_t address, const HTSmapsEntry** vma)
{
    auto* linuxTask = dynamic_cast<HTLinuxTaskPort*>(&task);
    if (linuxTask == nullptr) return KERN_INVALID_ARGUMENT;
    // A walk starts at address 0: that is when the mappings are read anew,
    // unless the image listing has just read them for this walk.
    kern_return_t loaded = loadVmas(*linuxTask, address == 0 && !linuxTask->takeVmasKeptForWalk());
    if (loaded != KERN_SUCCESS) return loaded;
    *vma = linuxTask->vmaAtOrAbove(address);
    if (*vma != nullptr) return KERN_SUCCESS;
    // Past the last mapping the walk is over. The pagemap and the parsed
    // mappings are let go until the next query: a run over thousands of
    // processes keeps all their handles at once.
    linuxTask->closePagemap();
    linuxTask->releaseVmas();
    return KERN_INVALID_ADDRESS;
}

kern_return_t HTLinuxMappings::regionRecurse(HTTaskPort& task, uint64_t* address, uint64_t* size,
                                             vm_region_submap_info_64* info, uint32_t* count)
{
    if (address == nullptr || size == nullptr || info == nullptr || count == nullptr) return KERN_INVALID_ARGUMENT;
    const HTSmapsEntry* vma = nullptr;
    kern_return_t found = vmaAtOrAbove(task, *address, &vma);
    if (found != KERN_SUCCESS) return found;
    *info = htSubmapInfo(*vma, task.pid(), htKernelPageSize());
    *address = vma->start;
    *size = vma->size();
    *count = VM_REGION_SUBMAP_INFO_COUNT_64;
    return KERN_SUCCESS;
}

kern_return_t HTLinuxMappings::region(HTTaskPort& task, uint64_t* address, uint64_t* size,
                                      vm_region_basic_info_64* info, uint32_t* count)
{
    if (address == nullptr || size == nullptr || info == nullptr || count == nullptr) return KERN_INVALID_ARGUMENT;
    const HTSmapsEntry* vma = nullptr;
    kern_return_t found = vmaAtOrAbove(task, *address, &vma);
    if (found != KERN_SUCCESS) return found;
    *info = htBasicInfo(*vma);
    *address = vma->start;
    *size = vma->size();
    *count = VM_REGION_BASIC_INFO_COUNT_64;
    return KERN_SUCCESS;
}

int HTLinuxMappings::regionFileName(HTTaskPort& task, uint64_t address, char* buffer, uint32_t bufferSize)
{
    auto* linuxTask = dynamic_cast<HTLinuxTaskPort*>(&task);
    if (linuxTask == nullptr || buffer == nullptr || bufferSize == 0) return 0;
    if (loadVmas(*linuxTask, false) != KERN_SUCCESS) return 0;
    const HTSmapsEntry* vma = linuxTask->vmaContaining(address);
    // Pseudo-paths such as "[heap]" name no file.
    if (vma == nullptr || vma->path.empty() || vma->path.front() != '/') return 0;
    size_t length = std::min<size_t>(vma->path.size(), bufferSize);
    std::memcpy(buffer, vma->path.data(), length);
    return static_cast<int>(length);
}

bool HTLinuxMappings::forEachImage(HTTaskPort& task, const std::function<void(const HTPlatformImage&)>& callback)
{
    auto* linuxTask = dynamic_cast<HTLinuxTaskPort*>(&task);
    if (linuxTask == nullptr) {
        errno = EINVAL;
        return false;
    }
    // The images are found among the mappings of the process's smaps, and
    // the walk of its address space that follows takes the same reading:
    // one pass of the kernel over the process's page tables serves both.
    HTLinuxTaskPort::DirectoryUse directory(*linuxTask);
    kern_return_t loaded = loadVmas(*linuxTask, true);
    if (loaded != KERN_SUCCESS) {
        errno = loaded == MACH_SEND_INVALID_DEST ? ESRCH : loaded & ~HT_KERN_ERRNO_BASE;
        return false;
    }
    linuxTask->keepVmasForNextWalk();
    imageReader_.forEachTaskImage(directory.fd(), linuxTask->vmas(), callback);
    return true;
}
