#pragma once

// Records and constants of the kernel interface heft is written against.
// Each backend fills them from what its own kernel exposes.

#include <cstdint>

using kern_return_t = int32_t;

inline constexpr kern_return_t KERN_SUCCESS = 0;
inline constexpr kern_return_t KERN_INVALID_ADDRESS = 1;
inline constexpr kern_return_t KERN_INVALID_ARGUMENT = 4;
inline constexpr kern_return_t KERN_FAILURE = 5;
inline constexpr kern_return_t MACH_SEND_INVALID_DEST = 0x10000003;
// A failure the backend met as an errno: the code carries the errno in its
// low 16 bits so that the error text can name it.
inline constexpr kern_return_t HT_KERN_ERRNO_BASE = 0x0e000000;

// proc_pidinfo flavors.
inline constexpr int PROC_PIDTBSDINFO = 3;
inline constexpr int PROC_PIDT_SHORTBSDINFO = 13;

// pbi_flags bits.
inline constexpr uint32_t PROC_FLAG_SYSTEM = 0x1;
inline constexpr uint32_t PROC_FLAG_LP64 = 0x10;

// pbi_status / pbsi_status values.
inline constexpr uint32_t SIDL = 1;
inline constexpr uint32_t SRUN = 2;
inline constexpr uint32_t SSLEEP = 3;
inline constexpr uint32_t SSTOP = 4;
inline constexpr uint32_t SZOMB = 5;

// proc_get_dirty flags.
inline constexpr uint32_t PROC_DIRTY_TRACKED = 0x1;
inline constexpr uint32_t PROC_DIRTY_ALLOWS_IDLE_EXIT = 0x2;
inline constexpr uint32_t PROC_DIRTY_IS_DIRTY = 0x4;

// sysctl names.
inline constexpr int CTL_KERN = 1;
inline constexpr int KERN_ARGMAX = 8;
inline constexpr int KERN_PROCARGS2 = 49;

inline constexpr int MAXCOMLEN = 16;

// The process information record (136 bytes).
struct proc_bsdinfo {
    uint32_t pbi_flags;
    uint32_t pbi_status;
    uint32_t pbi_xstatus;
    uint32_t pbi_pid;
    uint32_t pbi_ppid;
    uint32_t pbi_uid;
    uint32_t pbi_gid;
    uint32_t pbi_ruid;
    uint32_t pbi_rgid;
    uint32_t pbi_svuid;
    uint32_t pbi_svgid;
    uint32_t rfu_1;
    char pbi_comm[MAXCOMLEN];
    char pbi_name[2 * MAXCOMLEN];
    uint32_t pbi_nfiles;
    uint32_t pbi_pgid;
    uint32_t pbi_pjobc;
    uint32_t e_tdev;
    uint32_t e_tpgid;
    int32_t pbi_nice;
    uint64_t pbi_start_tvsec;
    uint64_t pbi_start_tvusec;
};
static_assert(sizeof(proc_bsdinfo) == 136, "proc_bsdinfo is 136 bytes");

// The short process information record (64 bytes).
struct proc_bsdshortinfo {
    uint32_t pbsi_pid;
    uint32_t pbsi_ppid;
    uint32_t pbsi_pgid;
    uint32_t pbsi_status;
    char pbsi_comm[MAXCOMLEN];
    uint32_t pbsi_flags;
    uint32_t pbsi_uid;
    uint32_t pbsi_gid;
    uint32_t pbsi_ruid;
    uint32_t pbsi_rgid;
    uint32_t pbsi_svuid;
    uint32_t pbsi_svgid;
    uint32_t pbsi_rfu;
};
static_assert(sizeof(proc_bsdshortinfo) == 64, "proc_bsdshortinfo is 64 bytes");
