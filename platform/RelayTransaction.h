// Transactions of the message service: the process-wide busy counter.
//
// While at least one transaction is open the daemon has work that must not
// be cut short (start-up, a pending background deletion, a protection change
// waiting for unlock). Whoever stops the daemon in an orderly way - the
// service manager's stop request, an idle exit - asks `count()` and waits for
// zero. A transaction is opened by `begin()` and closed by exactly one
// `end()`; `Guard` pairs them for a scope or for the life of a work item.
#pragma once

#include <cstdint>

namespace berth {

class RelayTransaction {
  public:
    // Opens a transaction.
    static void begin();
    // Closes one transaction. Closing more than were opened is a programming
    // error and ends the process.
    static void end();
    // The number of open transactions; stale as soon as returned.
    static uint64_t count();

    // One transaction open for the life of the object. Movable, so a work
    // item can carry its transaction along and close it when it is done.
    class Guard {
      public:
        Guard() : open_(true) { begin(); }
        ~Guard() {
            if (open_) end();
        }
        Guard(Guard&& other) noexcept : open_(other.open_) { other.open_ = false; }
        Guard& operator=(Guard&&) = delete;
        Guard(const Guard&) = delete;
        Guard& operator=(const Guard&) = delete;

      private:
        bool open_;
    };
};

}  // namespace berth
