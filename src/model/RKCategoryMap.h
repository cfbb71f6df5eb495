// Categories keyed by their name, as the analysis builds them and the formatters print them.
#pragma once

#include <map>
#include <memory>
#include <string>

class RKMemoryCategory;

using RKCategoryMap = std::map<std::string, std::shared_ptr<RKMemoryCategory>>;
