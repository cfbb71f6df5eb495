#include "analysis/RKCancelSource.h"

#include <poll.h>
#include <pthread.h>
#include <sys/eventfd.h>
#include <sys/signalfd.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <thread>

struct RKCancelSource::State {
    std::function<void()> handler;
    int signalFd = -1;  // reads the SIGINTs pending for the process
    int stopFd = -1;    // an eventfd: readable once the source is cancelled
    pthread_t installer{};
    bool wasBlocked = false;  // SIGINT's membership in the installer's mask before
    std::thread listener;

    ~State() {
        if (signalFd >= 0) ::close(signalFd);
        if (stopFd >= 0) ::close(stopFd);
    }
};

namespace {

sigset_t sigintSet() {
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, SIGINT);
    return set;
}

// Reads every queued SIGINT; true when at least one was there.
bool drain(int signalFd) {
    bool any = false;
    signalfd_siginfo info;
    while (::read(signalFd, &info, sizeof(info)) == static_cast<ssize_t>(sizeof(info))) any = true;
    return any;
}

void listen(const std::shared_ptr<RKCancelSource::State>& state) {
    pollfd fds[2] = {{state->stopFd, POLLIN, 0}, {state->signalFd, POLLIN, 0}};
    for (;;) {
        if (::poll(fds, 2, -1) < 0) {
            if (errno == EINTR) continue;
            return;
        }
        if (fds[0].revents) return;
        if ((fds[1].revents & POLLIN) && drain(state->signalFd)) state->handler();
    }
}

void setDisposition(void (*action)(int)) {
    struct sigaction sa {};
    sa.sa_handler = action;
    sigemptyset(&sa.sa_mask);
    ::sigaction(SIGINT, &sa, nullptr);
}

void restoreMask(const RKCancelSource::State& state) {
    if (state.wasBlocked || !pthread_equal(state.installer, pthread_self())) return;
    sigset_t set = sigintSet();
    pthread_sigmask(SIG_UNBLOCK, &set, nullptr);
}

}  // namespace

std::unique_ptr<RKCancelSource> RKCancelSource::install(std::function<void()> handler) {
    auto state = std::make_shared<State>();
    state->handler = std::move(handler);
    state->installer = pthread_self();
    sigset_t set = sigintSet(), previous;
    pthread_sigmask(SIG_BLOCK, &set, &previous);
    state->wasBlocked = sigismember(&previous, SIGINT) == 1;
    state->signalFd = ::signalfd(-1, &set, SFD_NONBLOCK | SFD_CLOEXEC);
    state->stopFd = ::eventfd(0, EFD_CLOEXEC);
    if (state->signalFd < 0 || state->stopFd < 0) {
        restoreMask(*state);
        return nullptr;
    }
    setDisposition(SIG_IGN);
    try {
        state->listener = std::thread(listen, state);  // starts with SIGINT blocked, as we are
    } catch (...) {
        setDisposition(SIG_DFL);
        restoreMask(*state);
        return nullptr;
    }
    return std::unique_ptr<RKCancelSource>(new RKCancelSource(std::move(state)));
}

void RKCancelSource::cancel() {
    std::shared_ptr<State> state = std::move(state_);
    if (!state) return;
    uint64_t one = 1;
    if (::write(state->stopFd, &one, sizeof(one)) != sizeof(one)) {
        // An eventfd write fails only on counter overflow; the listener is already stopping.
    }
    if (state->listener.get_id() == std::this_thread::get_id()) {
        state->listener.detach();  // cancelled from the handler: the listener ends on its own
    } else if (state->listener.joinable()) {
        state->listener.join();
    }
    drain(state->signalFd);  // a SIGINT that came before now is not for the next owner
    setDisposition(SIG_DFL);
    restoreMask(*state);
}
