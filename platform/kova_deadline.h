// Port layer: the monotonic clock every time limit of the library is kept on.
#ifndef KOVA_PLATFORM_KOVA_DEADLINE_H
#define KOVA_PLATFORM_KOVA_DEADLINE_H

#include <limits.h>

#include <chrono>

namespace kova {

// A point in time after which an operation must not go on, or none. Kept on the monotonic
// clock (CLOCK_MONOTONIC), so that setting the wall clock neither shortens nor lengthens it.
// Units are milliseconds; what is left is rounded up, so that a deadline that has not passed
// never reports 0 left and one that reports nothing left has passed.
// A value type: copies are independent; one object may be read on several threads at once,
// and must not be assigned while another thread reads it.
class Deadline {
  public:
    // What LeftMs reports without a deadline; no deadline that runs reports it.
    static constexpr long kNoneLeft = LONG_MAX;

    // No deadline: never expired, kNoneLeft left.
    Deadline() = default;

    // `milliseconds` from now; no deadline for 0 or less. A span past the clock's range ends
    // at the clock's last instant.
    static Deadline After(long milliseconds) {
        Deadline deadline;
        if (milliseconds > 0) {
            const Clock::time_point now = Clock::now();
            const auto room = std::chrono::duration_cast<Millis>(Clock::time_point::max() - now);
            deadline.at_ =
                milliseconds < room.count() ? now + Millis(milliseconds) : Clock::time_point::max();
            deadline.set_ = true;
        }
        return deadline;
    }

    // Whether there is a deadline.
    bool IsSet() const { return set_; }

    // Whether there is a deadline and it has passed.
    bool Expired() const { return set_ && Clock::now() >= at_; }

    // Milliseconds until the deadline, rounded up: 0 or less once it has passed (at least
    // LONG_MIN), at most kNoneLeft - 1 while it runs; kNoneLeft without a deadline.
    long LeftMs() const {
        if (!set_) {
            return kNoneLeft;
        }
        const Millis::rep left = std::chrono::ceil<Millis>(at_ - Clock::now()).count();
        if (left >= kNoneLeft) {
            return kNoneLeft - 1;
        }
        return left > LONG_MIN ? static_cast<long>(left) : LONG_MIN;
    }

  private:
    using Clock = std::chrono::steady_clock;
    using Millis = std::chrono::milliseconds;

    bool set_ = false;
    Clock::time_point at_;
};

}  // namespace kova

#endif  // KOVA_PLATFORM_KOVA_DEADLINE_H
