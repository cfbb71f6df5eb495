#include "support/RKUnprivileged.h"

#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <system_error>

namespace {

namespace fs = std::filesystem;

// A copy of the binary in a directory of its own, removed when the test program ends.
class ReachableBinary {
public:
    explicit ReachableBinary(const fs::path& source)
        : directory_(fs::temp_directory_path() /
                     ("memspread-e2e-" + std::to_string(::getpid()) + "-" + source.filename().string())),
          name_(source.filename()) {
        fs::create_directories(directory_);
        fs::copy_file(source, path(), fs::copy_options::overwrite_existing);
        ::chmod(directory_.c_str(), 0755);
        ::chmod(path().c_str(), 0755);
    }
    ~ReachableBinary() {
        std::error_code ignored;
        fs::remove_all(directory_, ignored);
    }
    fs::path path() const { return directory_ / name_; }

private:
    fs::path directory_;
    fs::path name_;
};

}  // namespace

std::vector<std::string> RKCommandAsNobody(const std::vector<std::string>& arguments) {
    static const ReachableBinary binary(MEMSPREAD_BINARY);
    std::vector<std::string> command = {"setpriv", "--reuid=nobody", "--regid=nogroup", "--clear-groups",
                                        binary.path().string()};
    command.insert(command.end(), arguments.begin(), arguments.end());
    return command;
}

std::vector<std::string> RKVmsnapCommandAsNobody(const std::vector<std::string>& arguments) {
    static const ReachableBinary binary(VMSNAP_BINARY);
    std::vector<std::string> command = {"setpriv", "--reuid=nobody", "--regid=nogroup", "--clear-groups",
                                        binary.path().string()};
    command.insert(command.end(), arguments.begin(), arguments.end());
    return command;
}
