#include "model/RKProcessGroup.h"

#include <algorithm>
#include <typeinfo>

#include "model/RKAssert.h"

RKProcessGroupMinimal::RKProcessGroupMinimal() : processes_(std::make_shared<RKProcessSet>()) {}

RKProcessGroupMinimal::RKProcessGroupMinimal(std::shared_ptr<RKProcessSet> processes, uint64_t hashValue)
    : processes_(std::move(processes)), hashValue_(hashValue) {}

void RKProcessGroupMinimal::addProcess(const std::shared_ptr<RKProcess>& process) {
    if (!processes_->insert(process).second) return;
    // Modulo 2^64, with the pid widened with its sign.
    uint64_t pid = static_cast<uint64_t>(static_cast<int64_t>(process->pid()));
    hashValue_ = (hashValue_ * 37) ^ pid;
}

bool RKProcessGroupMinimal::_hasEqualMembers(const RKProcessGroupMinimal& other) const {
    if (processes_ == other.processes_) return true;
    return std::equal(processes_->begin(), processes_->end(), other.processes_->begin(), other.processes_->end(),
                      [](const auto& a, const auto& b) { return a->pid() == b->pid(); });
}

bool RKProcessGroupMinimal::isEqual(const RKProcessGroupMinimal& other) const { return _hasEqualMembers(other); }

std::string RKProcessGroupMinimal::description() const {
    std::string text = "RKProcessGroup{(";
    bool first = true;
    for (const auto& process : *processes_) {
        if (!first) text += ", ";
        text += process->description();
        first = false;
    }
    return text + ")}";
}

std::shared_ptr<RKProcessGroup> RKProcessGroupMinimal::immutableCopy() const {
    return std::make_shared<RKProcessGroup>(InternKey{}, processes_, hashValue_);
}

void RKProcessGroup::addProcess(const std::shared_ptr<RKProcess>&) {
    RKAssertionFailure("RKProcessGroup", "Attempt to add process to immutable RKProcessGroup");
}

bool RKProcessGroup::isEqual(const RKProcessGroupMinimal& other) const {
    if (typeid(other) == typeid(RKProcessGroupMinimal)) return _hasEqualMembers(other);
    return &other == static_cast<const RKProcessGroupMinimal*>(this);
}

void RKProcessGroup::attachCachedCategories(std::shared_ptr<RKCategoryMap> categories, uint32_t refcount) {
    RKAssert(refcount > 0, "RKProcessGroup", "cached categories need a refcount above 0");
    categories_ = std::move(categories);
    categoriesRefcount_ = refcount;
}

std::shared_ptr<RKCategoryMap> RKProcessGroup::consumeCachedCategories() {
    if (!categories_) return nullptr;
    std::shared_ptr<RKCategoryMap> handedOut = categories_;
    if (categoriesRefcount_-- == 1) categories_.reset();
    return handedOut;
}
