#include "master/loop.h"

#include <new>

namespace kpl::master {

Loop::Loop() : base_(event_base_new()) {
  if (!base_) throw std::bad_alloc();
}

Event::Event(const Loop& loop, int fd, short what, Action action)
    : action_(std::make_shared<Action>(std::move(action))),
      event_(event_new(loop.base(), fd, what, call, &action_)) {
  if (!event_) throw std::bad_alloc();
  if (what != 0) arm();
}

Event::Event(const Loop& loop, Action action) : Event(loop, -1, 0, std::move(action)) {}

void Event::arm(std::chrono::milliseconds after) {
  const timeval time = {static_cast<time_t>(after.count() / 1000),
                        static_cast<suseconds_t>(after.count() % 1000 * 1000)};
  if (event_add(event_.get(), &time) != 0) throw std::bad_alloc();
}

void Event::arm() {
  if (event_add(event_.get(), nullptr) != 0) throw std::bad_alloc();
}

void Event::call(int, short, void* action) noexcept {
  const auto kept = *static_cast<std::shared_ptr<Action>*>(action);
  (*kept)();
}

}  // namespace kpl::master
