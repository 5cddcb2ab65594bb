#include "cli/HTExecRun.h"

#include "base/HTNoticeLog.h"
#include "base/HTStringFormat.h"
#include "process/HTCorpseProcess.h"

#include <sys/wait.h>

#include <cstring>

HTExecRun::HTExecRun(std::shared_ptr<HTPlatform> platform, const HTSettings& settings, bool skipIdleExitClean)
    : platform_(std::move(platform)), settings_(settings), skipIdleExitClean_(skipIdleExitClean)
{
}

HTProgramEnd HTExecRun::run(const std::vector<std::string>& arguments, bool followChildren)
{
    return platform_->runProgram(arguments, followChildren, [this](const HTHeldExit& held) { _gatherCorpse(held); });
}

void HTExecRun::_gatherCorpse(const HTHeldExit& held)
{
    // The held process can still say what it is called.
    proc_bsdinfo info{};
    std::string name = "?";
    if (platform_->proc_pidinfo(held.pid, PROC_PIDTBSDINFO, 0, &info, sizeof(info)) == sizeof(info))
        name = HTProcess::_nameForBsdInfo(*platform_, info);

    auto corpse = std::make_shared<HTCorpseProcess>(platform_);
    corpse->setSettings(settings_);
    if (!corpse->initWithCorpse(held.corpse, held.pid, name, held.dirtyFlags, held.procFlags)) {
        HTNoticeLog::standardError().add("%s: could not be read at its exit; not reported", held.pid,
                                         htStringWithFormat("%s [%d]", name.c_str(), held.pid));
        return;
    }
    if (skipIdleExitClean_ && corpse->idleExitStatus() == HTIdleExitStatusClean) return;
    if (held.pageTableBytes) corpse->addLedgerData(&*held.pageTableBytes, 1);
    corpse->gatherData();
    corpses_.push_back(std::move(corpse));
}

int HTExecRun::exitStatus(const HTProgramEnd& end)
{
    if (end.startError != 0) return end.startError == ENOENT ? 127 : 126;
    if (WIFSIGNALED(end.waitStatus)) return 128 + WTERMSIG(end.waitStatus);
    return WEXITSTATUS(end.waitStatus);
}

std::string HTExecRun::problem(const HTProgramEnd& end, const std::string& program)
{
    if (end.startError != 0) return htStringWithFormat("heft: %s: %s", program.c_str(), std::strerror(end.startError));
    if (end.traceError != 0)
        return htStringWithFormat("heft: %s ran without a report: it could not be held at its exit (ptrace: %s; "
                                  "tracing may be restricted here, as by kernel.yama.ptrace_scope or a seccomp "
                                  "policy)",
                                  program.c_str(), std::strerror(end.traceError));
    return "";
}
