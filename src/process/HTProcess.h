#pragma once

#include "base/HTPidMap.h"
#include "base/HTSettings.h"
#include "platform/HTPlatform.h"

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

class HTMemoryRegion;
class HTAuxDataMap;

// Idle-exit status of a process.
enum : int32_t {
    HTIdleExitStatusUnknown = 0,
    HTIdleExitStatusNotControlled = 1,
    HTIdleExitStatusClean = 2,
    HTIdleExitStatusDirty = 3,
};

// A process as the analysis sees it: a live user process, the kernel, a
// corpse or a saved snapfile. Subclasses fill memoryRegions in gatherData,
// after the run's settings; HTProcessDiscovery finds and makes them.
class HTProcess {
public:
    // Map from pid to the name it was found by, or nullopt when it was given
    // as a number.
    using PidDescriptionMap = HTPidMap<std::optional<std::string>>;
    using ProcessMap = HTPidMap<std::shared_ptr<HTProcess>>;

    explicit HTProcess(std::shared_ptr<HTPlatform> platform);
    virtual ~HTProcess();
    HTProcess(const HTProcess&) = delete;
    HTProcess& operator=(const HTProcess&) = delete;

    // Fills the identity from the record and opens the process; false when
    // the process cannot be read (the object is then to be discarded).
    // Subclasses run this first and add their own steps.
    virtual bool initWithBsdInfo(const proc_bsdinfo& info);

    // --- overridable behaviour -----------------------------------------
    // The name the process is known by; from its record for a live one.
    virtual std::string _nameForProcess(const proc_bsdinfo& info);
    virtual bool _populateTask();
    virtual uint64_t _gatherPageSize();
    virtual void gatherData();
    virtual bool _isAlive();
    // Null stands for "no auxiliary data".
    virtual std::shared_ptr<HTAuxDataMap> auxData();

    // --- the run's settings ------------------------------------------------
    // Set when the process is made, before it is gathered.
    const HTSettings& settings() const { return settings_; }
    void setSettings(const HTSettings& settings) { settings_ = settings; }
    bool breakDownPhysHeft() const { return settings_.breakDownPhysHeft; }
    bool sharingAnalysisDisabled() const { return settings_.sharingAnalysisDisabled; }

    // --- fields ----------------------------------------------------------
    int32_t pid() const { return pid_; }
    void setPid(int32_t pid) { pid_ = pid; }
    bool is64bit() const { return is64bit_; }
    void setIs64bit(bool value) { is64bit_ = value; }
    int32_t idleExitStatus() const { return idleExitStatus_; }
    // A snapshot copy.
    std::vector<std::string> errors() const { return errors_; }
    std::vector<std::string>& warnings() { return warnings_; }
    const std::vector<std::string>& warnings() const { return warnings_; }
    bool hiddenFromDisplay() const { return hiddenFromDisplay_; }
    void setHiddenFromDisplay(bool value) { hiddenFromDisplay_ = value; }
    const std::string& name() const { return name_; }
    void setName(std::string value) { name_ = std::move(value); }
    // Empty until gathered; hasMemoryRegions() tells "none" from "no regions".
    const std::vector<std::shared_ptr<HTMemoryRegion>>& memoryRegions() const;
    bool hasMemoryRegions() const { return memoryRegions_.has_value(); }
    void setMemoryRegions(std::optional<std::vector<std::shared_ptr<HTMemoryRegion>>> regions);
    const std::string& displayString() const { return displayString_; }
    void setDisplayString(std::string value) { displayString_ = std::move(value); }
    uint64_t pageSize() const { return pageSize_; }
    void setPageSize(uint64_t value) { pageSize_ = value; }

    // Processes are equal by pid, whatever their kind.
    bool isEqual(const HTProcess& other) const { return pid_ == other.pid_; }

    HTPlatform& platform() const { return *platform_; }

    // The name a process record stands for: the executable's file name from
    // its arguments, else the record's own short name.
    static std::string _nameForBsdInfo(HTPlatform& platform, const proc_bsdinfo& info);
    static std::string _nameForBsdInfoCommName(const proc_bsdinfo& info);

    // The program-wide list of errors not tied to one process. Written on
    // the main thread only.
    static void _addGlobalError(std::string error);
    static std::vector<std::string> globalErrors();
    static void _clearGlobalErrors();
    // While set, errors added on the calling thread go to `list` rather than
    // to the global list: processes set up side by side each keep theirs
    // apart, and the caller adds them in the order of its own list. Returns
    // the list it replaces; null restores the global list.
    static std::vector<std::string>* _captureGlobalErrors(std::vector<std::string>* list);

protected:
    void addError(std::string error) { errors_.push_back(std::move(error)); }
    void setIdleExitStatus(int32_t status) { idleExitStatus_ = status; }

private:
    std::shared_ptr<HTPlatform> platform_;
    HTSettings settings_;
    int32_t pid_ = 0;
    bool is64bit_ = false;
    int32_t idleExitStatus_ = HTIdleExitStatusUnknown;
    std::vector<std::string> errors_;
    std::vector<std::string> warnings_;
    bool hiddenFromDisplay_ = false;
    std::string name_;
    std::optional<std::vector<std::shared_ptr<HTMemoryRegion>>> memoryRegions_;
    std::string displayString_;
    uint64_t pageSize_ = 0;
};
