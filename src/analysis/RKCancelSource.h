// SIGINT as an event: while a source is installed, each SIGINT calls its handler on a thread of
// its own (never inside an asynchronous signal handler), and SIGINT no longer ends the process.
//
// Install it from the main thread before other threads start: SIGINT is blocked in the
// installing thread, and threads started afterwards inherit that, so the signal stays pending
// for the source instead of being taken by some thread. Its disposition is "ignore" meanwhile,
// so a thread that was started earlier and does not block it drops it rather than dying.
#pragma once

#include <signal.h>

#include <functional>
#include <memory>

class RKCancelSource {
public:
    // Starts listening. Nothing when the signal cannot be received this way (then SIGINT is
    // left as it was).
    static std::unique_ptr<RKCancelSource> install(std::function<void()> handler);

    ~RKCancelSource() { cancel(); }
    RKCancelSource(const RKCancelSource&) = delete;
    RKCancelSource& operator=(const RKCancelSource&) = delete;

    // Stops listening: the handler is not called again, SIGINTs not yet handled are dropped,
    // SIGINT's default action is restored, and when called on the installing thread, SIGINT is
    // unblocked there again if it was before. Safe to call twice, and from the handler itself.
    void cancel();
    bool isCancelled() const { return state_ == nullptr; }

    struct State;

private:
    explicit RKCancelSource(std::shared_ptr<State> state) : state_(std::move(state)) {}
    std::shared_ptr<State> state_;
};
