/* The load of bench/scale.sh: one parent that writes MAPPINGS private anonymous mappings of
 * 64 KiB each (kept apart by unmapped holes, so the kernel cannot merge them) and one more
 * mapping of MIB written MiB, then forks CHILDREN times. The children share every page
 * copy-on-write, which is what a forking server looks like to memspread.
 *
 *   scale-load CHILDREN MAPPINGS MIB
 *
 * Prints "ready PID" on standard output once every child exists, then waits for SIGTERM,
 * SIGINT or SIGHUP (or for its standard input to close), kills the children and reaps them.
 * A child dies with its parent (PR_SET_PDEATHSIG), so a killed parent leaves nothing behind. */
#define _GNU_SOURCE
#include <errno.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

static volatile sig_atomic_t stop_requested;

static void on_stop(int sig) {
    (void)sig;
    stop_requested = 1;
}

static long parse_count(const char* text, const char* what) {
    char* end = NULL;
    errno = 0;
    long value = strtol(text, &end, 10);
    if (errno || *end || value < 0) {
        fprintf(stderr, "scale-load: bad %s: %s\n", what, text);
        exit(2);
    }
    return value;
}

int main(int argc, char** argv) {
    if (argc != 4) {
        fprintf(stderr, "usage: scale-load CHILDREN MAPPINGS MIB\n");
        return 2;
    }
    const long children = parse_count(argv[1], "children");
    const long mappings = parse_count(argv[2], "mappings");
    const long mib = parse_count(argv[3], "MiB");
    const size_t piece = 64 * 1024;

    /* One reservation of twice the size, every other piece unmapped: the holes keep the
     * mappings distinct VMAs without adding PROT_NONE ones. */
    if (mappings > 0) {
        char* base = mmap(NULL, 2 * piece * (size_t)mappings, PROT_READ | PROT_WRITE,
                          MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE, -1, 0);
        if (base == MAP_FAILED) {
            perror("scale-load: mmap");
            return 1;
        }
        for (long i = 0; i < mappings; i++) {
            char* at = base + 2 * piece * (size_t)i;
            if (munmap(at + piece, piece) != 0) {
                perror("scale-load: munmap");
                return 1;
            }
            memset(at, (int)(i & 0x7f) + 1, piece);
        }
    }
    if (mib > 0) {
        size_t size = (size_t)mib << 20;
        char* block = mmap(NULL, size, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
        if (block == MAP_FAILED) {
            perror("scale-load: mmap");
            return 1;
        }
        memset(block, 0x5a, size);
    }

    struct sigaction action;
    memset(&action, 0, sizeof action);
    action.sa_handler = on_stop;
    sigaction(SIGTERM, &action, NULL);
    sigaction(SIGINT, &action, NULL);
    sigaction(SIGHUP, &action, NULL);

    pid_t* pids = calloc((size_t)children + 1, sizeof *pids);
    if (!pids) return 1;
    const pid_t parent = getpid();
    long started = 0;
    for (; started < children && !stop_requested; started++) {
        pid_t pid = fork();
        if (pid < 0) {
            perror("scale-load: fork");
            break;
        }
        if (pid == 0) {
            prctl(PR_SET_PDEATHSIG, SIGKILL);
            if (getppid() != parent) _exit(0);
            signal(SIGTERM, SIG_DFL);
            signal(SIGINT, SIG_DFL);
            signal(SIGHUP, SIG_DFL);
            for (;;) pause();
        }
        pids[started] = pid;
    }

    if (!stop_requested) {
        printf("ready %d\n", (int)parent);
        fflush(stdout);
        /* Where standard input is a pipe, its closing (the script died without a signal
         * reaching us) also stops. */
        struct stat input;
        const int watch = fstat(STDIN_FILENO, &input) == 0 && S_ISFIFO(input.st_mode);
        char byte;
        while (!stop_requested) {
            if (!watch) {
                pause();
                continue;
            }
            ssize_t n = read(STDIN_FILENO, &byte, 1);
            if (n == 0) break;
            if (n < 0 && errno != EINTR) break;
        }
    }
    for (long i = 0; i < started; i++) kill(pids[i], SIGKILL);
    for (long i = 0; i < started; i++) waitpid(pids[i], NULL, 0);
    free(pids);
    return 0;
}
