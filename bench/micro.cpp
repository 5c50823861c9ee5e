// What the library itself costs, over a base API that returns at once: a request, a query, the routing of a
// notification, a trace line that is off, the reader/writer lock. Each is set against something plain that is
// measured in the same run.
#include <benchmark/benchmark.h>
#include <pthread.h>

#include <chrono>
#include <cstring>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "bench/figures.h"
#include "bench/medians.h"
#include "gscl/gscl.h"
#include "gscl/gslib_dli.h"

namespace {

using zelt_gscl_V1::GSController;
using zelt_gscl_V1::GSProvider;

// ------------------------------------------------------------------------------------ a base API that does
// nothing

wyx_rc_t setup(int, int, wyx_descriptor_t* descriptor, wyx_socket_ctrl_t, const wyx_responsiveness_t*, const char*,
               wyx_responsiveness_cb_t*, wyx_delayed_error_cb_t*, wyx_query_cb_t*, ...) {
  *descriptor = 0;
  return WYX_OK;
}
wyx_rc_t quit() { return WYX_OK; }
wyx_rc_t join(wyx_token_t* token, const wyx_proposal_info_t*) {
  static wyx_token_t next = 0;
  *token = next++;
  return WYX_OK;
}
wyx_rc_t change_state_value(wyx_token_t, const wyx_proposal_info_t*) { return WYX_OK; }
wyx_rc_t get_node_number(int* node) {
  *node = 1;
  return WYX_OK;
}

GSAPIRtnCollection_t instant_base_api() {
  GSAPIRtnCollection_t table{};
  table.wyx_setup = setup;
  table.wyx_quit = quit;
  table.wyx_join = join;
  table.wyx_change_state_value = change_state_value;
  table.wyx_get_node_number = get_node_number;
  return table;
}

GSAPIRtnCollection_t base_api = instant_base_api();

// ----------------------------------------------------------------------------------------------- what is measured

class Quiet : public GSProvider {
 public:
  using GSProvider::GSProvider;
  void approvedCb(const wyx_approved_notification_t*) override {}
};

constexpr unsigned kMembers = 8;
constexpr int kStateLength = 64;  // bytes

/// An approved state change in a group of eight, and before it the approved join, for one provider.
class Approval {
 public:
  explicit Approval(const GSProvider& provider) {
    for (unsigned i = 0; i < kMembers; i++) ids_[i]._gs_provider_info = {static_cast<short>(i), 1};
    members_ = {kMembers, ids_};
    state_ = {kStateLength, bytes_};
    std::memset(bytes_, 's', sizeof bytes_);
    proposal_.gs_phase_info = {1, 1};
    proposal_.gs_proposed_by = ids_[0];
    proposal_.gs_whats_changed = static_cast<wyx_whats_changed_t>(
        WYX_UPDATED_MEMBERSHIP | WYX_UPDATED_STATE_VALUE | WYX_CURRENT_STATE_VALUE);
    proposal_.gs_current_providers = &members_;
    proposal_.gs_current_state_value = &state_;
    record_.gs_notification_type = WYX_APPROVED_NOTIFICATION;
    record_.gs_provider_token = provider.getToken();
    record_.gs_summary_code = WYX_EXPLICIT_APPROVE;
    record_.gs_proposal = &proposal_;
  }
  void route(wyx_request_t protocol) {
    record_.gs_protocol_type = protocol;
    record_.gs_event_seqnum++;
    GSController::stub_approvedCb(&record_);
  }

 private:
  wyx_provider_t ids_[kMembers];
  wyx_membership_t members_;
  char bytes_[kStateLength];
  wyx_state_value_t state_;
  wyx_proposal_t proposal_{};
  wyx_approved_notification_t record_{};
};

/// A controller and joined providers, the last of which is routed to or requests.
class Application {
 public:
  explicit Application(int clients) {
    controller_.initialize();
    for (int i = 0; i < clients; i++) {
      providers_.push_back(std::make_unique<Quiet>("bench", static_cast<short>(i), nullptr));
      providers_.back()->joinGroup();
      Approval(*providers_.back()).route(WYX_JOIN);
    }
  }
  GSProvider& provider() { return *providers_[providers_.size() / 2]; }

 private:
  GSController controller_;
  std::vector<std::unique_ptr<Quiet>> providers_;
};

bool at_fault = false;  // something measured did not do its work

void fault(benchmark::State& state, const char* what) {
  at_fault = true;
  state.SkipWithError(what);
}

void mutex_pair(benchmark::State& state) {
  pthread_mutex_t mutex = PTHREAD_MUTEX_INITIALIZER;
  for (auto _ : state) {
    pthread_mutex_lock(&mutex);
    pthread_mutex_unlock(&mutex);
  }
}

void request(benchmark::State& state) {
  Application application(1);
  char bytes[kStateLength] = {};
  const wyx_state_value_t value{kStateLength, bytes};
  for (auto _ : state) {
    if (application.provider().changeStateValue(value, WYX_1_PHASE, 0) != WYX_OK) fault(state, "refused");
  }
}

void query(benchmark::State& state) {
  int node = 0;
  for (auto _ : state) benchmark::DoNotOptimize(GSController::get_node_number(&node));
  if (node != 1) fault(state, "not answered");
}

void plain_pointer(benchmark::State& state) {
  wyx_get_node_number_func_t pointer = base_api.wyx_get_node_number;
  int node = 0;
  for (auto _ : state) {
    benchmark::DoNotOptimize(pointer);
    benchmark::DoNotOptimize(pointer(&node));
  }
}

void routing(benchmark::State& state) {
  Application application(static_cast<int>(state.range(0)));
  GSProvider& provider = application.provider();
  Approval approval(provider);
  for (auto _ : state) approval.route(WYX_STATE_VALUE_CHANGE);
  if (provider.getMemberCount() != kMembers) fault(state, "not routed");
}

void trace_off(benchmark::State& state) {
  int number = 1;
  for (auto _ : state) {
    benchmark::DoNotOptimize(number);
    GStracef(GSCL_TRC_API, "a line that is off: %d\n", number);
  }
}

void read_lock(benchmark::State& state) {
  zelt_gscl_V1::GSRWLockImpl lock;
  for (auto _ : state) {
    lock.ReadLock(nullptr);
    lock.ReadUnlock();
  }
}

void write_lock(benchmark::State& state) {
  zelt_gscl_V1::GSRWLockImpl lock;
  for (auto _ : state) {
    lock.WriteLock(nullptr);
    lock.WriteUnlock();
  }
}

BENCHMARK(mutex_pair);
BENCHMARK(request);
BENCHMARK(query);
BENCHMARK(plain_pointer);
BENCHMARK(routing)->Arg(1)->Arg(1000);
BENCHMARK(trace_off);
BENCHMARK(read_lock);
BENCHMARK(write_lock);

// ------------------------------------------------------------------------------------------------------- the
// figures

zn::Figures judge(const zn::Medians& m) {
  const double pair = m.of("mutex_pair");
  zn::Figures figures;
  figures.add("request, trace off", m.of("request") / pair, "mutex pairs", 8);
  figures.add("static query, over the same call through a pointer", m.of("query") - m.of("plain_pointer"), "ns",
              2);
  figures.add("routing an approval (8 members, 64 bytes), 1 client", m.of("routing1") / pair, "mutex pairs", 20);
  figures.add("the same with 1,000 clients", m.of("routing1000") / m.of("routing1"), "times that");
  figures.add("a trace line that is off", m.of("trace_off"), "ns", 2);
  figures.add("read lock and unlock", m.of("read_lock") / (2 * pair), "x 2 mutex pairs", 1.3);
  figures.add("write lock and unlock", m.of("write_lock") / (2 * pair), "x 2 mutex pairs", 1.3);
  return figures;
}

}  // namespace

int main(int argc, char** argv) {
  GSAPIRtns = &base_api;
  GSSetDebugLevel(0);
  zn::print_host();
  const std::string json = zn::option(argc, argv, "benchmark_out");

  // The threads library spares a process with one thread the atomic operations; ours have several.
  std::thread another([] { std::this_thread::sleep_for(std::chrono::hours(1)); });
  another.detach();

  zn::Medians medians(&benchmark::BenchmarkReporter::Run::GetAdjustedCPUTime);
  zn::run_interleaved(argc, argv, {"--benchmark_repetitions=11", "--benchmark_min_time=0.05"}, &medians);
  if (at_fault || medians.count() != 9) return 1;

  const zn::Figures figures = judge(medians);
  figures.print();
  return figures.write_json(json.empty() ? "" : json + ".figures.json") ? 0 : 1;
}
