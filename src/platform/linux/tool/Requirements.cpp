// What measuring cannot do without: the kernel's files about processes, and descriptors to read them by.

#include "base/Format.h"
#include "platform/linux/io/SystemFiles.h"
#include "platform/system.h"

#include <sys/resource.h>
#include <unistd.h>

namespace tally::platform {

namespace {

constexpr rlim_t fewestDescriptors = 24; // the streams and documents, and some for each process under way

} // namespace

std::string whatMeasuringLacks() {
    rlimit limit{};
    allowDescriptors(0);
    if (getrlimit(RLIMIT_NOFILE, &limit) == 0 && limit.rlim_cur < fewestDescriptors) {
        return formatted("Too few file descriptors are allowed: %llu, at least %llu are needed (ulimit -n)",
                         static_cast<unsigned long long>(limit.rlim_cur),
                         static_cast<unsigned long long>(fewestDescriptors));
    }
    if (access(systemPath("/proc/self/stat").c_str(), R_OK) != 0) {
        return "Processes are measured by the proc file system, which is not at /proc (mount -t proc proc "
               "/proc)";
    }
    return {};
}

} // namespace tally::platform
