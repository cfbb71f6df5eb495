#include "platform/RKErrorCapture.h"

#include <cstdio>

namespace {

thread_local RKErrorCapture* tCapture = nullptr;

}  // namespace

RKErrorCapture::RKErrorCapture() : previous_(tCapture) { tCapture = this; }

RKErrorCapture::~RKErrorCapture() { tCapture = previous_; }

void RKWriteError(std::string_view text) {
    if (tCapture) {
        tCapture->text_.append(text);
        return;
    }
    std::fwrite(text.data(), 1, text.size(), stderr);
}
