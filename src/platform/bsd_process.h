// BSD process information: which processes there are, who they are, and what their ledgers say.
//
// Calls that fail set errno: ESRCH for a process that does not exist (any more), EPERM or EACCES where rights
// are missing, ENOENT for an entry that this system does not have. All calls are thread-safe.

#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <vector>

namespace tally::platform {

inline constexpr std::uint32_t PROC_FLAG_SYSTEM = 0x1;
inline constexpr std::uint32_t PROC_FLAG_LP64 = 0x10;

/// Identity of one process (136 bytes). The two names need not end in a NUL.
struct proc_bsdinfo {
    std::uint32_t pbi_flags = 0;  // PROC_FLAG_...
    std::uint32_t pbi_status = 0; // SZOMB or another state
    std::uint32_t pbi_pid = 0;
    std::uint32_t pbi_ppid = 0;
    char pbi_comm[16] = {}; // command name
    char pbi_name[32] = {}; // process name, empty when there is none
    char reserved[72] = {};
};
static_assert(sizeof(proc_bsdinfo) == 136);

/// The short identity record (64 bytes).
struct proc_bsdshortinfo {
    std::uint32_t pbsi_pid = 0;
    std::uint32_t pbsi_ppid = 0;
    std::uint32_t pbsi_status = 0;
    char pbsi_comm[16] = {};
    char reserved[36] = {};
};
static_assert(sizeof(proc_bsdshortinfo) == 64);

inline constexpr std::uint32_t SRUN = 2;  // status of a process that lives
inline constexpr std::uint32_t SZOMB = 5; // status of one that has ended and waits for its parent

/// Lists pids into `pids`, in ascending order, as many as fit. With no room: how many there are.
/// @return the count, or -1 with errno.
int proc_listallpids(std::span<std::int32_t> pids);

/// Fills the identity record of `pid`. Threads of the kernel are no processes of their own.
/// @return the record's size, or 0 with errno.
int proc_pidinfo(std::int32_t pid, proc_bsdinfo* info);

/// Fills the short identity record of `pid`, zombies included.
/// @return the record's size, or 0 with errno.
int proc_pidinfo(std::int32_t pid, proc_bsdshortinfo* info);

/// Memory charged to a process, in bytes.
struct rusage_info_v5 {
    std::uint64_t ri_phys_tally = 0;              // what it is charged for now
    std::uint64_t ri_lifetime_max_phys_tally = 0; // the most it was ever charged for
    std::uint64_t ri_resident_anonymous = 0;      // its resident anonymous memory
};

/// Reads the usage record of `pid`, also where its mappings may not be read.
/// @return 0, or -1 with errno.
int proc_pid_rusage(std::int32_t pid, rusage_info_v5* info);

inline constexpr std::uint32_t PROC_DIRTY_TRACKED = 0x1;
inline constexpr std::uint32_t PROC_DIRTY_ALLOWS_IDLE_EXIT = 0x2;
inline constexpr std::uint32_t PROC_DIRTY_IS_DIRTY = 0x4;

/// Reads the idle-exit flags of `pid` (PROC_DIRTY_...). @return 0, or -1 with errno (flags untouched).
int proc_get_dirty(std::int32_t pid, std::uint32_t* flags);

/// Writes the name of the file behind the mapping at `address` into `buffer`, without a NUL; a name that is
/// too long is cut.
/// @return its length; 0 or less when there is none.
int proc_regionfilename(std::int32_t pid, std::uint64_t address, std::span<char> buffer);

/// Name, group and units of one ledger entry; each is NUL-padded.
struct ledger_template_info {
    char lti_name[32] = {};
    char lti_group[32] = {};
    char lti_units[32] = {};
};
static_assert(sizeof(ledger_template_info) == 96);

struct ledger_entry_info {
    std::int64_t lei_balance = 0; // bytes for the entries that are memory
    std::int64_t lei_credit = 0;
    std::int64_t lei_debit = 0;
    std::int64_t lei_limit = 0;
    std::int64_t lei_refill_period = 0;
    std::int64_t lei_last_refill = 0;
};
static_assert(sizeof(ledger_entry_info) == 48);

/// Lists the ledger entries that the kernel defines, as many as fit. @return the count, or -1 with errno.
int ledger_template(std::span<ledger_template_info> entries);

/// Reads the ledger of `pid`, as many entries as fit. @return the count, or -1 with errno.
int ledger_entries(std::int32_t pid, std::span<ledger_entry_info> entries);

/// The largest size of a process's argument area, in bytes. @return 0, or -1 with errno.
int sysctl_argmax(std::uint64_t* size);

/// Reads the argument area of `pid`: the argument count (4 bytes), the executable's path with a NUL, NUL
/// padding, then the arguments. @return its length, or -1 with errno.
std::ptrdiff_t sysctl_procargs2(std::int32_t pid, std::span<char> area);

/// Reads or writes the integer entry `name` ("vm.self_region_tally"). @return 0, or -1 with errno.
int sysctlbyname_read(const char* name, std::int32_t* value);
int sysctlbyname_write(const char* name, std::int32_t value);

/// An object that a task keeps alive, whether it maps it or not. Sizes in bytes.
struct owned_vmobject {
    std::uint64_t id = 0;
    std::uint64_t virtualSize = 0;
    std::uint64_t residentSize = 0;
    std::uint64_t wiredSize = 0;
    std::uint64_t reusableSize = 0;
    std::uint64_t compressedSize = 0; // swapped out
    bool noTally = false;             // somebody else is charged for it
    std::uint8_t ledgerTag = 0;       // 0-7
    std::uint8_t purgeable = 0;       // VM_PURGABLE_...

    bool holdsMemory() const { return residentSize + compressedSize != 0; }
};

/// What a task owns ("vm.get_owned_vmobjects"). @return absent with errno; ENOENT where there is no such
/// list.
std::optional<std::vector<owned_vmobject>> sysctl_owned_vmobjects(std::uint32_t task);

/// Page size of the kernel in bytes.
std::uint64_t vm_kernel_page_size();

} // namespace tally::platform
