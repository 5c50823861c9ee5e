// A small worker pool: jobs are handed to four thread objects through a market until Ctrl-C (SIGINT) or until as
// many as the first argument says have been handed out; then every job is finished and all threads are joined.
//
//   worker_pool [JOBS]
#include <signal.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <vector>

#include "gscl/gscl.h"

using zelt_gscl_V1::GSMarket;
using zelt_gscl_V1::GSObject;
using zelt_gscl_V1::GSThread;

// What goes through a market is a GSObject. Whoever has taken a job out owns it.
class Job : public GSObject {
 public:
  explicit Job(int limit) : limit_(limit) {}

  int countPrimes() const {
    int primes = 0;
    for (int n = 2; n < limit_; ++n) {
      bool prime = true;
      for (int d = 2; prime && d * d <= n; ++d) prime = n % d != 0;
      primes += prime ? 1 : 0;
    }
    return primes;
  }

 private:
  const int limit_;
};

class Worker : public GSThread {
 public:
  explicit Worker(GSMarket& market) : GSThread(0), market_(market) {}
  // `run` uses members, so it must be over before they go.
  ~Worker() override {
    stop();
    join(nullptr);
  }

  // Sleeps in `consume` while there is nothing to do; null says that the market was stopped.
  void* run(void*) override {
    while (auto job = std::unique_ptr<GSObject>(market_.consume(nullptr))) {
      primes_ += static_cast<Job&>(*job).countPrimes();
      ++done_;
    }
    return nullptr;
  }
  int done() const { return done_; }
  long primes() const { return primes_; }

 private:
  GSMarket& market_;
  std::atomic<int> done_{0};
  std::atomic<long> primes_{0};
};

int main(int argc, char** argv) {
  const int jobs = argc > 1 ? std::atoi(argv[1]) : 0;  // 0: until SIGINT

  // Blocked here, before there are threads, SIGINT stays blocked in all of them and is waited for below.
  sigset_t interrupt;
  sigemptyset(&interrupt);
  sigaddset(&interrupt, SIGINT);
  pthread_sigmask(SIG_BLOCK, &interrupt, nullptr);

  GSMarket market(0);
  std::vector<std::unique_ptr<Worker>> workers;
  for (int i = 0; i < 4; ++i) {
    workers.push_back(std::make_unique<Worker>(market));
    if (workers.back()->start(nullptr) == ~pthread_t{0}) return 1;
  }
  std::printf("%zu workers, a job every 5 ms; Ctrl-C stops\n", workers.size());
  std::fflush(stdout);

  int handedOut = 0;
  const timespec pause = {0, 5000000};
  while ((jobs == 0 || handedOut < jobs) && sigtimedwait(&interrupt, nullptr, &pause) != SIGINT) {
    market.produce(new Job(1000 + handedOut++ % 7 * 1000));
  }

  // Workers that wait come back with null, the others take what is left first, and what they leave is finished
  // here.
  market.stopMarket();
  for (auto& worker : workers) worker->join(nullptr);
  int done = 0;
  long primes = 0;
  for (auto& worker : workers) {
    done += worker->done();
    primes += worker->primes();
  }
  while (auto job = std::unique_ptr<GSObject>(market.consume(nullptr))) {
    primes += static_cast<Job&>(*job).countPrimes();
    ++done;
  }
  std::printf("stopped: %d jobs handed out, %d done, %ld primes found\n", handedOut, done, primes);
  return done == handedOut ? 0 : 1;
}
