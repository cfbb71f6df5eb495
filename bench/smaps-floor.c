/* The floor of any smaps reader: read /proc/PID/smaps of every process (or of the PIDs given)
 * whole, with THREADS threads taking processes in turn, and nothing else. Whatever memspread
 * does beyond this is its own cost.
 *
 *   smaps-floor [-m] THREADS [PID...]
 *
 * -m also reads, after each smaps, the pagemap of every private anonymous mapping that smaps
 * shows shared or swapped pages in: the page data that telling fork-shared pages apart needs,
 * and the kernel's own cost of it.
 *
 * Prints one line: processes read, bytes read, wall seconds. */
#define _GNU_SOURCE
#include <ctype.h>
#include <dirent.h>
#include <fcntl.h>
#include <pthread.h>
#include <stdatomic.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <time.h>
#include <unistd.h>

static int* pids;
static size_t pid_count;
static atomic_size_t next_pid;
static atomic_ullong bytes_read;
static atomic_size_t processes_read;

static int with_pagemap;

static unsigned long long field_kib(const char* line, const char* name) {
    size_t length = strlen(name);
    return strncmp(line, name, length) == 0 ? strtoull(line + length, NULL, 10) : 0;
}

/* The pagemap of the mappings the smaps `text` shows with shared or swapped anonymous pages. */
static void read_pagemap(int pid, const char* text, size_t length) {
    char path[64];
    snprintf(path, sizeof path, "/proc/%d/pagemap", pid);
    int fd = open(path, O_RDONLY | O_CLOEXEC);
    if (fd < 0) return;
    static __thread unsigned long long entries[4096];
    unsigned long long start = 0, end = 0, shared = 0;
    int anonymous = 0;
    const char* stop = text + length;
    for (const char* line = text; line < stop;) {
        const char* next = memchr(line, '\n', (size_t)(stop - line));
        next = next ? next + 1 : stop;
        size_t hex = strspn(line, "0123456789abcdef");
        int header = hex > 0 && line[hex] == '-';
        if (header || next == stop) {
            for (unsigned long long page = start / 4096; anonymous && shared && page < end / 4096;) {
                unsigned long long count = end / 4096 - page < 4096 ? end / 4096 - page : 4096;
                if (pread(fd, entries, count * 8, (off_t)(page * 8)) <= 0) break;
                page += count;
            }
            anonymous = 0, shared = 0;
        }
        if (header) {
            /* start-end perms offset dev inode [path] */
            char* at;
            start = strtoull(line, &at, 16);
            end = strtoull(at + 1, &at, 16);
            const char* perms = at + 1;
            strtoull(perms + 5, &at, 16);
            at = strchr(at + 1, ' ');
            anonymous = perms[3] == 'p' && at && strtoull(at + 1, NULL, 10) == 0;
        } else {
            shared += field_kib(line, "Shared_Clean:") + field_kib(line, "Shared_Dirty:") + field_kib(line, "Swap:");
        }
        line = next;
    }
    close(fd);
}

static void* reader(void* unused) {
    (void)unused;
    size_t capacity = 1 << 20;
    char* buffer = malloc(capacity);
    char path[64];
    for (;;) {
        size_t at = atomic_fetch_add(&next_pid, 1);
        if (at >= pid_count) break;
        snprintf(path, sizeof path, "/proc/%d/smaps", pids[at]);
        int fd = open(path, O_RDONLY | O_CLOEXEC);
        if (fd < 0) continue;
        unsigned long long total = 0;
        ssize_t n;
        /* Whole: one buffer that grows, as a parser that holds the text would need. */
        while ((n = read(fd, buffer + total, capacity - total)) > 0) {
            total += (size_t)n;
            if (total == capacity) {
                capacity *= 2;
                buffer = realloc(buffer, capacity);
            }
        }
        close(fd);
        if (with_pagemap) read_pagemap(pids[at], buffer, total);
        atomic_fetch_add(&bytes_read, total);
        atomic_fetch_add(&processes_read, 1);
    }
    free(buffer);
    return NULL;
}

int main(int argc, char** argv) {
    if (argc > 1 && strcmp(argv[1], "-m") == 0) {
        with_pagemap = 1;
        argv++, argc--;
    }
    if (argc < 2) {
        fprintf(stderr, "usage: smaps-floor [-m] THREADS [PID...]\n");
        return 2;
    }
    int threads = atoi(argv[1]);
    if (threads < 1) threads = 1;
    struct timespec begin, end;
    clock_gettime(CLOCK_MONOTONIC, &begin);

    size_t capacity = 1024;
    pids = malloc(capacity * sizeof *pids);
    if (argc > 2) {
        for (int i = 2; i < argc; i++) {
            if (pid_count == capacity) pids = realloc(pids, (capacity *= 2) * sizeof *pids);
            pids[pid_count++] = atoi(argv[i]);
        }
    } else {
        DIR* proc = opendir("/proc");
        struct dirent* entry;
        while (proc && (entry = readdir(proc))) {
            if (!isdigit((unsigned char)entry->d_name[0])) continue;
            if (pid_count == capacity) pids = realloc(pids, (capacity *= 2) * sizeof *pids);
            pids[pid_count++] = atoi(entry->d_name);
        }
        if (proc) closedir(proc);
    }

    pthread_t* workers = calloc((size_t)threads, sizeof *workers);
    for (int i = 0; i < threads; i++) pthread_create(&workers[i], NULL, reader, NULL);
    for (int i = 0; i < threads; i++) pthread_join(workers[i], NULL);
    clock_gettime(CLOCK_MONOTONIC, &end);
    double seconds = (double)(end.tv_sec - begin.tv_sec) + (double)(end.tv_nsec - begin.tv_nsec) / 1e9;
    printf("%zu processes, %llu bytes, %.3f s\n", atomic_load(&processes_read),
           (unsigned long long)atomic_load(&bytes_read), seconds);
    free(workers);
    free(pids);
    return 0;
}
