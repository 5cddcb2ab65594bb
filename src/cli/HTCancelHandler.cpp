#include "cli/HTCancelHandler.h"

#include <csignal>

std::unique_ptr<HTSignalSource> installCancelHandler(HTPlatform& platform, std::function<void()> callback)
{
    // On a terminal Ctrl-C ends the program at once, as the user expects;
    // with the report going elsewhere it stops the gathering instead, and
    // the report of what was gathered still follows.
    if (platform.isatty(1)) return nullptr;
    return HTSignalSource::create(SIGINT, std::move(callback));
}
