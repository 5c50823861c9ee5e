// What the library's queues cost between threads, each against the plain construction that does the same, measured
// in the same run: the event queue's wake-up against a bare condition variable, the market's throughput against a
// std::queue under one mutex and one condition.
#include <benchmark/benchmark.h>

#include <atomic>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <queue>
#include <semaphore>
#include <string>
#include <thread>
#include <vector>

#include "bench/figures.h"
#include "bench/medians.h"
#include "gscl/gscl.h"

namespace {

using zelt_gscl_V1::GSIntegerEventQueue;
using zelt_gscl_V1::GSMarket;
using zelt_gscl_V1::GSObject;

// ------------------------------------------------------------------------------------------------ wake-up latency

/// One event at a time, and nothing around it.
class BareCondition {
 public:
  void post(int event) {
    std::lock_guard<std::mutex> lock(mutex_);
    event_ = event;
    full_ = true;
    condition_.notify_one();
  }
  int wait() {
    std::unique_lock<std::mutex> lock(mutex_);
    condition_.wait(lock, [this] { return full_; });
    full_ = false;
    return event_;
  }

 private:
  std::mutex mutex_;
  std::condition_variable condition_;
  bool full_ = false;
  int event_ = 0;
};

class Events {
 public:
  void post(int event) { queue_.post_event(event); }
  int wait() {
    int event = 0;
    queue_.wait_event(&event, -1, 0);
    return event;
  }

 private:
  GSIntegerEventQueue queue_;
};

bool at_fault = false;  // something measured did not do its work

/// There and back between two threads: an iteration is two posts, each waited for by a sleeping thread.
template <class Channel>
void wake_up(benchmark::State& state) {
  Channel there, back;
  std::thread peer([&] {
    for (int event = 0; event != -1;) back.post(event = there.wait());
  });
  int round = 0;
  for (auto _ : state) {
    there.post(++round);
    if (back.wait() != round) at_fault = true;
  }
  there.post(-1);
  peer.join();
}

// ------------------------------------------------------------------------------------------------ throughput

constexpr int kBatch = 20000;  // objects of one iteration

class PlainQueue {
 public:
  void put(GSObject* object) {
    {
      std::lock_guard<std::mutex> lock(mutex_);
      queue_.push(object);
    }
    condition_.notify_one();
  }
  GSObject* take() {
    std::unique_lock<std::mutex> lock(mutex_);
    condition_.wait(lock, [this] { return !queue_.empty() || closed_; });
    if (queue_.empty()) return nullptr;
    GSObject* object = queue_.front();
    queue_.pop();
    return object;
  }
  void close() {
    {
      std::lock_guard<std::mutex> lock(mutex_);
      closed_ = true;
    }
    condition_.notify_all();
  }

 private:
  std::mutex mutex_;
  std::condition_variable condition_;
  std::queue<GSObject*> queue_;
  bool closed_ = false;
};

class Market {
 public:
  void put(GSObject* object) { market_.produce(object); }
  GSObject* take() { return market_.consume(nullptr); }
  void close() { market_.stopMarket(); }

 private:
  GSMarket market_{kBatch + 1};  // like the other one after its first batch, it does not grow while measured
};

/// One producer hands a batch over to the consumers and waits until they have all of it.
template <class Place>
void throughput(benchmark::State& state) {
  Place place;
  GSObject object;
  std::atomic<int> left{0};
  std::binary_semaphore all_taken{0};
  std::vector<std::thread> consumers;
  for (int64_t i = 0; i < state.range(0); ++i) {
    consumers.emplace_back([&] {
      while (place.take() != nullptr) {
        if (--left == 0) all_taken.release();
      }
    });
  }
  for (auto _ : state) {
    left = kBatch;
    for (int i = 0; i < kBatch; ++i) place.put(&object);
    all_taken.acquire();
  }
  state.SetItemsProcessed(state.iterations() * kBatch);
  place.close();
  for (std::thread& consumer : consumers) consumer.join();
}

BENCHMARK_TEMPLATE(wake_up, BareCondition)->UseRealTime();
BENCHMARK_TEMPLATE(wake_up, Events)->UseRealTime();
BENCHMARK_TEMPLATE(throughput, PlainQueue)->Arg(1)->Arg(2)->Arg(4)->UseRealTime();
BENCHMARK_TEMPLATE(throughput, Market)->Arg(1)->Arg(2)->Arg(4)->UseRealTime();

// ----------------------------------------------------------------------------------------------- the figures

zn::Figures judge(const zn::Medians& m) {
  zn::Figures figures;
  figures.add("event queue, post to wake-up", m.of("wake_up<Events>") / m.of("wake_up<BareCondition>"),
              "x bare condition", 1.5);
  // With one consumer and hardly any contention the pairs show: an operation of the market takes the reader/writer
  // lock of its queue, two mutex pairs, where the plain queue takes one.
  for (const std::string consumers : {"1", "2", "4"}) {
    figures.add("market, one object, " + consumers + (consumers == "1" ? " consumer" : " consumers"),
                m.of("throughput<Market>" + consumers) / m.of("throughput<PlainQueue>" + consumers),
                "x std::queue, mutex, condition", 1.5);
  }
  return figures;
}

}  // namespace

int main(int argc, char** argv) {
  GSSetDebugLevel(0);
  zn::print_host();
  const std::string json = zn::option(argc, argv, "benchmark_out");

  zn::Medians medians(&benchmark::BenchmarkReporter::Run::GetAdjustedRealTime);
  zn::run_interleaved(argc, argv, {"--benchmark_repetitions=15", "--benchmark_min_time=0.1"}, &medians);
  if (at_fault || medians.count() != 8) return 1;

  const zn::Figures figures = judge(medians);
  figures.print();
  return figures.write_json(json.empty() ? "" : json + ".figures.json") ? 0 : 1;
}
