#include "driver/RKMemspreadArgs.h"

#include <getopt.h>

#include <cctype>
#include <charconv>
#include <cfloat>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <string_view>

#include "output/RKTextCategorySort.h"

namespace {

// Option values of the long options that have no short letter.
enum : int {
    kOptionPhysMemspread = 256,
    kOptionVmObjectDirty = 257,
    kOptionSwapped = 258,
    kOptionWired = 259,
    kOptionSort = 260,
    kOptionUnmapped = 261,
    kOptionMetrilog = 262,
    kOptionSample = 263,
};

constexpr const char* kShortOptions = "aj:htp:x:svf:yw";

std::string formatted(const char* format, const char* argument) {
    int length = std::snprintf(nullptr, 0, format, argument);
    std::string result(static_cast<size_t>(length), '\0');
    std::snprintf(result.data(), result.size() + 1, format, argument);
    return result;
}

// The argument's leading decimal number (white space and a sign allowed before it); text that
// does not begin with one reads as 0. Out-of-range numbers read as infinity, which is refused
// like every other value that is not a normal positive double.
double leadingDecimal(const char* text) {
    while (std::isspace(static_cast<unsigned char>(*text))) ++text;
    bool negative = *text == '-';
    if (*text == '-' || *text == '+') ++text;
    if (*text == '-') return 0.0;  // from_chars would take a second sign
    double value = 0.0;
    const char* end = text + std::strlen(text);
    // chars_format::general reads decimal and exponent notation only, never hexadecimal.
    std::errc status = std::from_chars(text, end, value, std::chars_format::general).ec;
    if (status == std::errc::result_out_of_range) return HUGE_VAL;
    if (status != std::errc()) return 0.0;
    return negative ? -value : value;
}

bool isAcceptedInterval(double seconds) {
    return std::isfinite(seconds) && seconds >= DBL_MIN;
}

}  // namespace

std::optional<RKMemspreadArgs> RKMemspreadArgs::initWithArgc(int argc, char** argv, RKError* error) {
    RKMemspreadArgs args;
    // --proc and --pid report themselves through these flags; getopt_long then returns 0.
    int procFlag = 0;
    int pidFlag = 0;
    const struct option longOptions[] = {
        {"all", no_argument, nullptr, 'a'},
        {"json", required_argument, nullptr, 'j'},
        {"metrilog", required_argument, nullptr, kOptionMetrilog},
        {"help", no_argument, nullptr, 'h'},
        {"targetChildren", no_argument, nullptr, 't'},
        {"proc", required_argument, &procFlag, 1},
        {"pid", required_argument, &pidFlag, 1},
        {"exclude", required_argument, nullptr, 'x'},
        {"skip", no_argument, nullptr, 's'},
        {"format", required_argument, nullptr, 'f'},
        {"sort", required_argument, nullptr, kOptionSort},
        {"summary", no_argument, nullptr, 'y'},
        {"physMemspread", no_argument, nullptr, kOptionPhysMemspread},
        {"vmObjectDirty", no_argument, nullptr, kOptionVmObjectDirty},
        {"wide", no_argument, nullptr, 'w'},
        {"swapped", no_argument, nullptr, kOptionSwapped},
        {"wired", no_argument, nullptr, kOptionWired},
        {"unmapped", no_argument, nullptr, kOptionUnmapped},
        {"sample", required_argument, nullptr, kOptionSample},
        {nullptr, 0, nullptr, 0},
    };

    // glibc reinitialises completely (including its permutation state) when optind is 0.
    optind = 0;
    optarg = nullptr;
    int option;
    while ((option = getopt_long(argc, argv, kShortOptions, longOptions, nullptr)) != -1) {
        if (option == 0) {
            if (procFlag) {
                procFlag = 0;
                option = 'p';
            } else if (pidFlag) {
                pidFlag = 0;
                option = 'P';
            } else {
                continue;
            }
        }
        if (!args._applyOption(option, optarg, error)) return std::nullopt;
    }
    args._checkAfterParsing();
    for (int index = optind; index < argc; ++index) args.potentialTargetProcesses_.insert(argv[index]);
    return args;
}

// `option` is getopt_long's answer, with 'P' standing for --pid (which has no short letter).
bool RKMemspreadArgs::_applyOption(int option, const char* argument, RKError* error) {
    switch (option) {
    case 'a': targetAll_ = true; break;
    case 'j': JSONOutputFile_ = argument; break;
    case kOptionMetrilog: metrilogOutputFile_ = argument; break;
    case 'h': RKError::set(error, RKMemspreadErrorDomain, RKMemspreadErrorHelp); return false;
    case 't': targetChildren_ = true; break;
    case 'p': potentialTargetProcesses_.insert(argument); break;
    case 'P': {
        char* end = nullptr;
        long value = std::strtol(argument, &end, 10);
        if (end == argument) {
            RKError::set(error, RKMemspreadErrorDomain, RKMemspreadErrorPid,
                         formatted("'%s' is not a valid integer for --pid.\n\n"
                                   "Use -p / --proc if you meant to specify a process name.",
                                   argument));
            return false;
        }
        targetPids_[static_cast<pid_t>(value)] = std::nullopt;
        break;
    }
    case 'x': excludedPidsOrProcesses_.insert(argument); break;
    case 's': skipIdleExitClean_ = true; break;
    case 'v':
        spanlistLikeOutput_ = true;
        summarize_ = false;
        break;
    case 'f':
        if (std::strcmp(argument, "bytes") == 0) {
            summaryFormat_ = RKSummaryFormatBytes;
        } else if (std::strcmp(argument, "formatted") == 0) {
            summaryFormat_ = RKSummaryFormatFormatted;
        } else if (std::strcmp(argument, "pages") == 0) {
            summaryFormat_ = RKSummaryFormatPages;
        } else {
            RKError::set(error, RKMemspreadErrorDomain, RKMemspreadErrorFormat,
                         "Unrecognized argument to -f / --format.\n"
                         "Accepted arguments: 'bytes', 'formatted', 'pages'.");
            return false;
        }
        break;
    case kOptionSort: {
        if (auto column = RKTextSortColumnNamed(argument)) {
            textSort_ = RKTextSortColumns[static_cast<size_t>(*column)];
            return true;
        }
        std::string accepted;
        for (std::string_view column : RKTextSortColumns) {
            if (!accepted.empty()) accepted += ", ";
            accepted += RKTextSortColumnArgument(column);
        }
        RKError::set(error, RKMemspreadErrorDomain, RKMemspreadErrorSort,
                     formatted("Unrecognized argument '%s' to --sort.\nAccepted arguments: ", argument) +
                         accepted);
        return false;
    }
    case 'y':
        std::fprintf(stderr, "WARNING: -y/--summary options are deprecated because summary is the default mode\n");
        break;
    case kOptionPhysMemspread:
        std::fprintf(stderr, "WARNING: --physMemspread option is deprecated because it is the default mode\n");
        break;
    case kOptionVmObjectDirty:
        shouldGetPhysMemspreadBreakdown_ = false;
        didSetShouldGetPhysMemspreadBreakdown_ = true;
        break;
    case 'w': textOptions_ |= RKTextOptionWired | RKTextOptionSwapped | RKTextOptionWide; break;
    case kOptionSwapped: textOptions_ |= RKTextOptionSwapped; break;
    case kOptionWired: textOptions_ |= RKTextOptionWired; break;
    case kOptionUnmapped: searchForUnmapped_ = true; break;
    case kOptionSample: {
        double seconds = leadingDecimal(argument);
        if (!isAcceptedInterval(seconds)) {
            RKError::set(error, RKMemspreadErrorDomain, RKMemspreadErrorSample,
                         formatted("Invalid sampling interval '%s'", argument));
            return false;
        }
        sampleInterval_ = seconds;
        break;
    }
    default:
        // '?': unknown option or missing argument; getopt_long has already said which.
        RKError::set(error, RKMemspreadErrorDomain, RKMemspreadErrorOption);
        return false;
    }
    return true;
}

void RKMemspreadArgs::_checkAfterParsing() {
    if (!shouldGetPhysMemspreadBreakdown_ && searchForUnmapped_) {
        std::fprintf(stderr,
                     "WARNING: ignoring '--unmapped' because the requested analysis mode "
                     "'--vmObjectDirty' does not support unmapped owned VM objects\n");
        searchForUnmapped_ = false;
    } else if (targetAll_ && searchForUnmapped_) {
        std::fprintf(stderr, "NOTICE: '--unmapped' is redundant when using -a/--all\n");
        searchForUnmapped_ = false;
    }
}
