#pragma once

#include "platform/HTPlatformTypes.h"

#include <string>

// The text heft shows for a kernel return code: a short phrase for the task
// and region codes, the system's error text for a code that carries an errno
// (HT_KERN_ERRNO_BASE | errno). Every backend answers mach_error_string with
// it, so that messages read the same whichever backend produced them.
std::string htMachErrorString(kern_return_t code);
