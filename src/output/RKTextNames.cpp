#include "output/RKTextNames.h"

std::string RKTextTruncatedName(std::string_view name, bool wide) {
    const size_t last = name.find_last_not_of('/');
    if (wide || last == std::string_view::npos) return std::string(name);
    const std::string_view trimmed = name.substr(0, last + 1);
    const size_t slash = trimmed.rfind('/');
    const std::string_view component = slash == std::string_view::npos ? trimmed : trimmed.substr(slash + 1);
    if (component.size() >= name.size()) return std::string(name);
    std::string shortened = ".../";
    shortened.append(component);
    return shortened;
}
