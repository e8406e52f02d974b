// Runs a call that might block for ever (on a FIFO, a lock, a socket) so
// that a block fails the test instead of hanging the suite.
#ifndef PLOVO_TESTS_SUPPORT_BOUNDED_H
#define PLOVO_TESTS_SUPPORT_BOUNDED_H

#include <chrono>
#include <functional>
#include <future>
#include <thread>

namespace plovo_test {

// Runs call on a thread of its own and returns its result, or -2 when it
// has not returned within 10 s; release() must then make it return.
inline int Bounded(const std::function<int()>& call, const std::function<void()>& release) {
  std::packaged_task<int()> task(call);
  std::future<int> result = task.get_future();
  std::thread thread(std::move(task));
  const bool done = result.wait_for(std::chrono::seconds(10)) == std::future_status::ready;
  if (!done) release();
  thread.join();
  return done ? result.get() : -2;
}

}  // namespace plovo_test

#endif
