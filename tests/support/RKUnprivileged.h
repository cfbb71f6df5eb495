// Running a program of the build as an unprivileged user from end-to-end tests.
#pragma once

#include <string>
#include <vector>

// The command that runs `binary` with `arguments` as user nobody. The binary is first copied to
// a directory every user can enter, since the build tree may sit below one only root can (a
// checkout in a private temporary directory, for example).
std::vector<std::string> RKAsNobody(const std::string& binary, const std::vector<std::string>& arguments);
