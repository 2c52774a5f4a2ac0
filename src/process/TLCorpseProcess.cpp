#include "process/TLCorpseProcess.h"

#include "base/Format.h"
#include "platform/kcdata.h"
#include "process/CorpseKcdata.h"

#include <algorithm>
#include <cstring>
#include <string_view>

namespace tally {

using namespace platform;

namespace {

constexpr std::size_t maxPathLength = 1023;

/// What the crash information says of the process.
struct CrashInformation {
    std::int32_t pid = -1;
    std::string name; // stays empty where none is told: what has its pid now may be another process
    std::uint32_t flags = 0;
    std::uint32_t dirtyFlags = ~std::uint32_t{0};
    TLUserProcess::Ledgers ledgers;
};

/// Reads a number at the start of `payload`, if it is long enough to hold one.
template <typename Number>
void readNumber(std::span<const std::byte> payload, Number& number) {
    if (payload.size() >= sizeof number) {
        std::memcpy(&number, payload.data(), sizeof number);
    }
}

std::string nameOfPath(std::span<const std::byte> payload) {
    const auto* const text = reinterpret_cast<const char*>(payload.data());
    std::string_view path(text, std::min(payload.size(), maxPathLength));
    path = path.substr(0, path.find('\0'));
    return std::string(path.substr(path.rfind('/') + 1));
}

void readItem(const KcdataItem& item, CrashInformation& information) {
    switch (item.type) {
    case crashPid:
        readNumber(item.payload, information.pid);
        break;
    case crashPath:
        information.name = nameOfPath(item.payload);
        break;
    case crashFlags:
        readNumber(item.payload, information.flags);
        break;
    case crashDirtyFlags:
        readNumber(item.payload, information.dirtyFlags);
        break;
    case crashPageTable:
        readNumber(item.payload, information.ledgers.pageTable);
        break;
    case crashPhysTally:
        readNumber(item.payload, information.ledgers.physTally);
        break;
    case crashPhysTallyPeak:
        readNumber(item.payload, information.ledgers.physTallyPeak);
        break;
    default:
        break;
    }
}

/// The flags of an identity record that say what the crash information's flags say.
std::uint32_t recordFlags(std::uint32_t told) {
    struct Translation {
        std::uint32_t crashFlag;
        std::uint32_t recordFlag;
    };
    constexpr Translation translations[] = {{0x200, PROC_FLAG_SYSTEM},
                                            {crashFlag64bit, PROC_FLAG_LP64},
                                            {0x2, 0x80},
                                            {0x100, 0x2000},
                                            {0x4000, 0x4000},
                                            {0x1000000, 0x100}};
    std::uint32_t flags = 0;
    for (const auto& [crashFlag, recordFlag] : translations) {
        flags |= (told & crashFlag) != 0 ? recordFlag : 0;
    }
    return flags;
}

} // namespace

std::shared_ptr<TLCorpseProcess> TLCorpseProcess::initWithCorpse(mach_port_t corpse) {
    CrashInformation information;
    if (!enumerateCorpseKcdata(corpse, [&](const KcdataItem& item) { readItem(item, information); })) {
        return nullptr;
    }
    if (const kern_return_t status = mach_port_retain(corpse); status != KERN_SUCCESS) {
        mach_error("initWithCorpse:mach_port_mod_refs", status);
        return nullptr;
    }
    const auto process = std::make_shared<TLCorpseProcess>();
    process->setTask(PortRight(corpse));
    process->setIsTranslated((information.flags & crashFlagTranslated) != 0);
    proc_bsdinfo info;
    info.pbi_flags = recordFlags(information.flags);
    info.pbi_pid = static_cast<std::uint32_t>(information.pid);
    if (!process->initWithBsdInfo(info)) {
        return nullptr;
    }
    process->setName(information.name);
    process->setDisplayString(formatted("%s [%d] (corpse)", process->name().c_str(), process->pid()));
    process->_setIdleExitStatusFromDirtyFlags(information.dirtyFlags);
    process->setLedgers(information.ledgers);
    return process;
}

} // namespace tally
