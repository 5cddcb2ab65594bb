#pragma once

#include <cstdint>

// A handle on another process's address space, opened by task_for_pid.
// Each backend derives its own; callers only hold and pass it back.
class HTTaskPort {
public:
    virtual ~HTTaskPort() = default;
    virtual int32_t pid() const = 0;
};
