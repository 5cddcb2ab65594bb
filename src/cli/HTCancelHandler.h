#pragma once

#include "platform/HTPlatform.h"
#include "platform/HTSignalSource.h"

#include <functional>
#include <memory>

// With standard output redirected, turns SIGINT into a call of `callback`
// on a thread of its own, so that an interrupted run still writes its
// report; null when standard output is a terminal, where Ctrl-C keeps
// ending the program at once. Cancel the source on the thread that
// installed it once gathering is over.
std::unique_ptr<HTSignalSource> installCancelHandler(HTPlatform& platform, std::function<void()> callback);
