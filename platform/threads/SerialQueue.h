#pragma once

#include <functional>
#include <memory>
#include <string>

#include "platform/threads/ProgrammingError.h"

namespace platform {

class RunLoop;

/// Runs work one piece after another, in the order in which it was submitted: on a thread of its
/// own, named by the label, or on a run loop that somebody else runs. `async` may be called from
/// any thread.
///
/// Destroying a queue with its own thread runs the work submitted so far, then joins the thread; it
/// must not happen on that thread. A queue on a run loop must not outlive the loop's owner.
class SerialQueue {
  public:
    /// A queue with a run loop on a thread of its own.
    explicit SerialQueue(std::string label);
    /// A queue on `loop`, which must outlive it.
    SerialQueue(std::string label, RunLoop& loop);
    SerialQueue(const SerialQueue&) = delete;
    ~SerialQueue();

    /// Enqueues the work and returns at once.
    void async(std::function<void()> work);

    /// Stops the process when the caller does not run on this queue: a programming error.
    void assertCurrent(CodePlace place = CodePlace::here()) const;
    bool isCurrent() const;

    const std::string& label() const;
    /// The loop that runs this queue's work: file descriptors can be watched on it.
    RunLoop& runLoop();

  private:
    struct State;
    std::unique_ptr<State> state_;
};

}  // namespace platform
