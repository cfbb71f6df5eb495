#include "support/RKUnprivileged.h"

#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <map>
#include <system_error>

namespace {

namespace fs = std::filesystem;

// Copies of binaries, each in a directory of its own, removed when the test program ends.
struct ReachableCopies {
    std::map<std::string, fs::path> copies;
    ~ReachableCopies() {
        std::error_code ignored;
        for (const auto& entry : copies) fs::remove_all(entry.second.parent_path(), ignored);
    }
    fs::path of(const fs::path& source) {
        auto [it, added] = copies.try_emplace(source.string());
        if (!added) return it->second;
        const fs::path directory = fs::temp_directory_path() /
                                   ("memspread-e2e-" + std::to_string(::getpid()) + "-" + source.filename().string());
        fs::create_directories(directory);
        it->second = directory / source.filename();
        fs::copy_file(source, it->second, fs::copy_options::overwrite_existing);
        ::chmod(directory.c_str(), 0755);
        ::chmod(it->second.c_str(), 0755);
        return it->second;
    }
};

}  // namespace

std::vector<std::string> RKAsNobody(const std::string& binary, const std::vector<std::string>& arguments) {
    static ReachableCopies copies;
    std::vector<std::string> command = {"/usr/bin/setpriv", "--reuid=nobody", "--regid=nogroup", "--clear-groups",
                                        copies.of(binary).string()};
    command.insert(command.end(), arguments.begin(), arguments.end());
    return command;
}
