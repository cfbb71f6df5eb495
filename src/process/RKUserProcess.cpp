#include "process/RKUserProcess.h"

#include <cerrno>
#include <cstring>

#include "model/RKAssert.h"
#include "model/RKAuxData.h"
#include "platform/RKErrorCapture.h"

namespace {

// The ledger template is the same for every process: read once for the run.
struct RKLedgerTemplate {
    int64_t count = -1;           // -1 after a failure
    int64_t pageTableIndex = -1;  // of the entry named "page_table"; -1 when absent
};

RKLedgerTemplate readLedgerTemplate() {
    RKLedgerTemplate result;
    std::vector<std::string> names;
    int error = RKPlatform::current().ledgerTemplate(names);
    if (error != 0) {
        RKWriteError(std::string("Unable to retrieve ledger template info: ") + std::strerror(error) + "\n");
        return result;
    }
    result.count = static_cast<int64_t>(names.size());
    for (size_t i = 0; i < names.size(); i++) {
        if (names[i] == "page_table") {
            result.pageTableIndex = static_cast<int64_t>(i);
            break;
        }
    }
    return result;
}

const RKLedgerTemplate& sharedLedgerTemplate() {
    static const RKLedgerTemplate ledgerTemplate = readLedgerTemplate();  // thread-safe, once
    return ledgerTemplate;
}

struct RKSharedRegionBounds {
    uint64_t base;
    uint64_t size;
};

// Indexed by RKPlatformCode, up to RKPlatformArm64_32.
constexpr RKSharedRegionBounds kSharedRegions[] = {
    {0x90000000, 0x20000000},       // RKPlatformI386
    {0x7FFF00000000, 0xFFE00000},   // RKPlatformX86_64
    {0x40000000, 0x40000000},       // RKPlatformArm
    {0x180000000, 0x100000000},     // RKPlatformArm64
    {0x1A000000, 0x40000000},       // RKPlatformArm64_32
};

}  // namespace

bool RKUserProcess::initWithBsdInfo(const RKBsdInfo& info) {
    setPid(info.pbi_pid);
    listedStartSeconds_ = info.pbi_start_tvsec;
    listedStartMicroseconds_ = info.pbi_start_tvusec;
    _gatherIsTranslated();
    if (!RKProcess::initWithBsdInfo(info)) return false;

    int32_t platform = RKPlatformLinux;
    if (RKPlatform::current().hasSharedRegion())
        platform = isTranslated() ? RKPlatformX86_64 : is64bit() ? RKPlatformArm64 : RKPlatformArm;
    _setSharedRegionFromPlatform(platform);

    images_.emplace();
    _gatherPhysMemspread();
    _gatherLedgers();
    _gatherIdleExitStatus();
    sharedRegionAlignmentSize_ = 4096;
    _releaseTask();  // opened again when gathering starts
    return true;
}

bool RKUserProcess::_setSharedRegionFromPlatform(int32_t platform) {
    if (platform >= 0 && platform <= RKPlatformArm64_32) {
        sharedRegionBase_ = kSharedRegions[platform].base;
        sharedRegionSize_ = kSharedRegions[platform].size;
        return true;
    }
    if (platform == RKPlatformUnknown) {
        RKWriteError("Unable to determine platform architecture of target\n");
        return false;
    }
    return true;
}

void RKUserProcess::_gatherPhysMemspread() {
    if (!_isAlive() || !task_) return;
    RKRusageInfo usage;
    if (RKPlatform::current().pidRusage(*task_, usage) != 0) return;  // keep what was there
    phys_memspread_ = usage.ri_phys_memspread;
    phys_memspread_peak_ = usage.ri_lifetime_max_phys_memspread;
}

void RKUserProcess::_gatherLedgers() {
    if (!breakDownPhysMemspread() || !_isAlive() || !task_) return;
    const RKLedgerTemplate& ledgerTemplate = sharedLedgerTemplate();
    if (ledgerTemplate.pageTableIndex < 0) return;
    std::vector<int64_t> balances;
    int error = RKPlatform::current().ledgerEntries(*task_, balances);
    if (error != 0) {
        errno = error;
        _addErrnoWarningWithDescription("Unable to retrieve ledger entry info");
        return;
    }
    auto index = static_cast<size_t>(ledgerTemplate.pageTableIndex);
    RKAssert(index < balances.size(), "RKUserProcess", "pageTableIndex < entry count");
    ledgers_ = balances[index] > 0 ? static_cast<uint64_t>(balances[index]) : 0;
}

void RKUserProcess::_gatherIdleExitStatus() {
    if (!_isAlive()) return;
    _setIdleExitStatusFromDirtyFlags(RKPlatform::current().dirtyFlags(pid()));
}

void RKUserProcess::_setIdleExitStatusFromDirtyFlags(uint32_t flags) {
    constexpr uint32_t managed = PROC_DIRTY_TRACKED | PROC_DIRTY_ALLOWS_IDLE_EXIT;
    if ((flags & managed) != managed)
        setIdleExitStatus(1);
    else
        setIdleExitStatus((flags & PROC_DIRTY_IS_DIRTY) ? 3 : 2);
}

std::shared_ptr<RKAuxDataMap> RKUserProcess::auxData() const {
    if (phys_memspread_ == 0) return nullptr;
    auto map = std::make_shared<RKAuxDataMap>();
    map->setObject("phys_memspread", std::make_shared<RKAuxData>(static_cast<int64_t>(phys_memspread_), false));
    map->setObject("phys_memspread_peak",
                   std::make_shared<RKAuxData>(static_cast<int64_t>(phys_memspread_peak_), false));
    return map;
}
