#include "output/RKMetricsLogWriter.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <optional>
#include <string>

#include "model/RKTime.h"
#include "output/RKMetricsLogLines.h"

namespace {

constexpr double kSecondsFrom1970To2001 = 978307200.0;

const char* unitName(mlunit_t unit) { return unit == mlunit_ms ? "ms" : "B"; }
const char* tagName(mltag_t tag) { return tag == mltag_context ? "context" : "summary"; }

double unixTimeNow() {
    std::optional<RKTime> now = RKTime::now();
    return now ? now->wallTime() + kSecondsFrom1970To2001 : 0;
}

}  // namespace

struct mlwriter {
    int fd = -1;
    bool durable = false;
    std::string name;
    std::string description;
    std::string primaryMetric;
    bool headerWritten = false;
    uint64_t group = 0;
    double groupTime = 0;
    std::optional<RKMetricsLogValue> value;  // the value still taking records
    std::string pending;                     // complete lines not yet written
    int writeError = 0;

    void completeValue() {
        if (!headerWritten) {
            pending += RKMetricsLogHeaderLine(name, description, primaryMetric);
            headerWritten = true;
        }
        if (!value) return;
        pending += RKMetricsLogValueLine(*value, groupTime);
        value.reset();
    }

    void writePending() {
        size_t done = 0;
        while (done < pending.size()) {
            ssize_t written = ::write(fd, pending.data() + done, pending.size() - done);
            if (written < 0 && errno == EINTR) continue;
            if (written <= 0) {
                writeError = written < 0 ? errno : EIO;
                break;
            }
            done += static_cast<size_t>(written);
        }
        pending.clear();
    }
};

mlwriter_t mlwriter_open(const char* path, const char* name, int truncate, int durable) {
    int flags = O_WRONLY | O_CREAT | O_CLOEXEC | (truncate ? O_TRUNC : O_APPEND);
    int fd = ::open(path, flags, 0644);
    if (fd < 0) return nullptr;
    auto* writer = new mlwriter;
    writer->fd = fd;
    writer->durable = durable != 0;
    writer->name = name;
    return writer;
}

void mlwriter_set_description(mlwriter_t writer, const char* description) { writer->description = description; }

void mlwriter_set_primary_metric(mlwriter_t writer, const char* metric) { writer->primaryMetric = metric; }

void mlwriter_new_group(mlwriter_t writer) {
    writer->completeValue();
    writer->group++;
    writer->groupTime = unixTimeNow();
}

void mlwriter_new_value(mlwriter_t writer, const char* metric, mlunit_t unit, double value) {
    writer->completeValue();
    if (writer->group == 0) mlwriter_new_group(writer);  // a value needs a group
    RKMetricsLogValue& next = writer->value.emplace();
    next.group = writer->group;
    next.metric = metric;
    next.unit = unitName(unit);
    next.value = value;
}

void mlwriter_record_variable_str(mlwriter_t writer, const char* key, const char* text) {
    if (writer->value) RKMetricsLogSetPair(writer->value->variables, key, text);
}

void mlwriter_record_label_str(mlwriter_t writer, const char* key, const char* text) {
    if (writer->value) RKMetricsLogSetPair(writer->value->labels, key, text);
}

void mlwriter_record_tag(mlwriter_t writer, mltag_t tag) {
    if (!writer->value) return;
    std::vector<std::string>& tags = writer->value->tags;
    std::string name = tagName(tag);
    for (const auto& existing : tags)
        if (existing == name) return;
    tags.push_back(std::move(name));
}

int mlwriter_flush(mlwriter_t writer) {
    writer->completeValue();
    writer->writePending();
    if (writer->durable && writer->writeError == 0 && ::fsync(writer->fd) != 0) writer->writeError = errno;
    if (writer->writeError == 0) return 0;
    errno = writer->writeError;
    return -1;
}

int mlwriter_close(mlwriter_t writer) {
    int result = mlwriter_flush(writer);
    int error = errno;
    if (::close(writer->fd) != 0 && result == 0) {
        result = -1;
        error = errno;
    }
    delete writer;
    errno = error;
    return result;
}
