// The measurement as named numeric metrics in a metrics-log file (--metrilog). One group of
// values per process and one summary group per report; the file is complete once close() ran.
#pragma once

#include <cstdio>
#include <memory>
#include <string>

#include "output/RKOutputFormatter.h"

class RKOutputFormatterMetrilog : public RKOutputFormatter {
public:
    // initWithPath: opens or creates the log. When it cannot be opened, writes
    // "Unable to open mlwriter: <system error>" to standard error and returns nullptr. The log is
    // named after the accounting mode in force when it is opened.
    static std::shared_ptr<RKOutputFormatterMetrilog> initWithPath(const std::string& path);

    const char* className() const override { return "RKOutputFormatterMetrilog"; }

    void printProcessHeader(const RKProcess& process) override;
    void endProcessHeader(const RKProcess&) override {}
    void printProcessTotal(uint64_t memspread, const RKProcess& process) override;
    void printProcessCategories(const RKCategoryMap& categories, const RKMemoryTotal& total) override;
    void printSharedCategories(const RKCategoryMap& categories, const RKProcessGroup& group,
                               const RKProcess& process, bool hasProcessView,
                               const RKMemoryTotal& total) override;
    void printProcessAuxData(const std::shared_ptr<RKAuxDataMap>& auxData) override;
    void printProcessesWithWarnings(const RKProcessList&, const RKProcessList&,
                                    const std::vector<std::string>&) override {}
    void printSummaryCategories(const RKCategoryMap& categories, const RKMemoryTotal& total,
                                bool hadErrors) override;
    void printGlobalAuxData(const std::shared_ptr<RKAuxDataMap>& auxData) override;
    void endAtTime(const RKTime& time) override;

    bool implementsStartAtTime() const override { return true; }
    void startAtTime(const RKTime& time) override;
    // Every sample simply adds its groups to the same log.
    bool implementsConfigureForMultipleOutputs() const override { return true; }
    void configureForMultipleOutputs() override {}
    bool implementsClose() const override { return true; }
    void close() override;

    const std::string& logName() const { return logName_; }
    bool isOpen() const { return file_ != nullptr; }

    struct FileCloser {
        void operator()(FILE* file) const { std::fclose(file); }
    };
    using File = std::unique_ptr<FILE, FileCloser>;

private:
    struct Opened {};  // only initWithPath constructs

public:
    RKOutputFormatterMetrilog(Opened, File file, std::string logName)
        : file_(std::move(file)), logName_(std::move(logName)) {}

private:
    File file_;
    std::string logName_;
};
