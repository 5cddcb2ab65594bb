#include "platform/HTMachErrorText.h"

#include <cstring>

std::string htMachErrorString(kern_return_t code)
{
    if ((code & ~0xffff) == HT_KERN_ERRNO_BASE) {
        // strerror_r rather than strerror: several gathering threads may ask
        // at once.
        char text[128];
        return strerror_r(code & 0xffff, text, sizeof(text));
    }
    switch (code) {
    case KERN_SUCCESS:
        return "success";
    case KERN_INVALID_ADDRESS:
        return "invalid address";
    case KERN_INVALID_ARGUMENT:
        return "invalid argument";
    case KERN_FAILURE:
        return "failure";
    case MACH_SEND_INVALID_DEST:
        return "process is gone";
    default:
        return "unknown error";
    }
}
