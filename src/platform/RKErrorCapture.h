// Messages for standard error from work that may run side by side. A thread holding an
// RKErrorCapture keeps its messages, so that the caller writes them in the order one thread
// doing the same work would have.
#pragma once

#include <string>
#include <string_view>

// Writes `text` to standard error, or appends it to the calling thread's capture.
void RKWriteError(std::string_view text);

class RKErrorCapture {
public:
    RKErrorCapture();  // the calling thread's messages go here until it is destroyed
    ~RKErrorCapture();
    RKErrorCapture(const RKErrorCapture&) = delete;
    RKErrorCapture& operator=(const RKErrorCapture&) = delete;

    std::string take() { return std::move(text_); }

private:
    friend void RKWriteError(std::string_view text);
    std::string text_;
    RKErrorCapture* previous_;
};
