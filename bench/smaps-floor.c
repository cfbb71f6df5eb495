/* The floor of any smaps reader: read /proc/PID/smaps of every process (or of the PIDs given)
 * whole, with THREADS threads taking processes in turn, and nothing else. Whatever memspread
 * does beyond this is its own cost.
 *
 *   smaps-floor THREADS [PID...]
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
        atomic_fetch_add(&bytes_read, total);
        atomic_fetch_add(&processes_read, 1);
    }
    free(buffer);
    return NULL;
}

int main(int argc, char** argv) {
    if (argc < 2) {
        fprintf(stderr, "usage: smaps-floor THREADS [PID...]\n");
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
