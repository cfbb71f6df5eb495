// The metrics-log writer: groups of named values with units, variables, labels and tags,
// written as JSON Lines (docs/metrics-log.md). A value is complete once the next value or group
// starts, so each line is written then; mlwriter_flush writes the last one, and every line
// reaches the file system at each flush: a log cut short loses at most the sample in progress.
#pragma once

#include <cstdint>

struct mlwriter;
using mlwriter_t = mlwriter*;

enum mlunit_t { mlunit_B, mlunit_ms };
enum mltag_t { mltag_summary, mltag_context };

// Opens the log at `path`, named `name`. `truncate` 1 starts the file anew, 0 appends to what
// is there; `durable` 1 makes every flush wait until the lines are on disk (fsync). Nothing,
// with errno set, when the file cannot be opened.
mlwriter_t mlwriter_open(const char* path, const char* name, int truncate, int durable);
void mlwriter_set_description(mlwriter_t writer, const char* description);
// The metric that best summarises the log: "name,variable=value".
void mlwriter_set_primary_metric(mlwriter_t writer, const char* metric);
void mlwriter_new_group(mlwriter_t writer);
// A value in the current group; the record calls that follow describe it.
void mlwriter_new_value(mlwriter_t writer, const char* metric, mlunit_t unit, double value);
void mlwriter_record_variable_str(mlwriter_t writer, const char* key, const char* text);
void mlwriter_record_label_str(mlwriter_t writer, const char* key, const char* text);
void mlwriter_record_tag(mlwriter_t writer, mltag_t tag);
// Writes every complete line and the value in progress, and hands them to the file system.
// 0, or -1 with errno set when a write failed.
int mlwriter_flush(mlwriter_t writer);
// Flushes and closes; the handle is gone. 0, or -1 with errno set.
int mlwriter_close(mlwriter_t writer);
