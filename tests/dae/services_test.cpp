// The small services of the daemon environment, and everything of start-up that needs no daemon.
#include <arpa/inet.h>
#include <dlfcn.h>
#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ipc.h>
#include <sys/msg.h>
#include <sys/prctl.h>
#include <sys/sem.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <functional>
#include <optional>

#include "../support/fresh_process.h"
#include "dae/dae_internal.h"

std::optional<dae_procsinfo_t> parent_entry;  // what the process table says of the parent; ids of 0 are its own
int removals = 0;                             // how often the lock's semaphore goes just before it is taken

// Both stand before what the library would call.
int dae_getprocs(pid_t pid, dae_procsinfo_t* entry) {
  static const auto real = reinterpret_cast<decltype(&dae_getprocs)>(dlsym(RTLD_NEXT, "dae_getprocs"));
  if (!parent_entry.has_value()) return real(pid, entry);
  *entry = *parent_entry;
  for (uint32_t* id : {&entry->pi_pid, &entry->pi_sid, &entry->pi_pgrp}) *id += *id == 0 ? uint32_t(pid) : 0;
  return 1;
}
extern "C" __attribute__((visibility("default"))) int semop(int id, sembuf* steps, size_t count) {
  if (removals-- > 0) semctl(id, 0, IPC_RMID);
  return static_cast<int>(syscall(SYS_semop, id, steps, count));
}

namespace {

dae_error_detail_t detail;
int descriptor;

void handler(int) {}
void other_handler(int) {}

/// The result of `step` and its detail, in a fresh process.
std::string outcome(const std::function<int()>& step) {
  const auto run = [&] {
    const int out = fcntl(1, F_DUPFD_CLOEXEC, 100);  // the step may have its own use for descriptor 1
    dae_detail_init__INTERNAL__(&detail, "test");
    const int code = step();
    dprintf(out, "%d %s", code, detail.dae_error_string);
  };
  return in_fresh_process(run).out;
}

TEST(ErrorDetail, Fields_are_cut_and_the_last_error_stays) {
  const auto all = [] {
    return std::string(detail.dae_routine) + "|" + detail.dae_error_string + "|" + detail.dae_filename + "|" +
           detail.dae_fileversion + "|" + std::to_string(detail.dae_fileline) +
           (dae_detail_is_set__INTERNAL__() == 1 ? " set" : "");
  };
  memset(&detail, 'x', sizeof detail);
  dae_detail_init__INTERNAL__(&detail, "a_routine_with_a_name_too_long");
  EXPECT_EQ(all(), "a_routine_with_a_na||||0");
  dae_detail_error__INTERNAL__("FIRST", "/a/folder/with.d/a_file_name_that_is_long.cpp", "1.2.3.4.5.6", 17);
  EXPECT_EQ(all(), "a_routine_with_a_na|FIRST|a_file_name_that_is|1.2.3.4.5|17 set");
  dae_detail_errno__INTERNAL__("open", ENOENT, "f.cpp", "1", 18);
  EXPECT_EQ(all(), "a_routine_with_a_na|open failed: No such file or directory|f.cpp|1|18 set");
  dae_detail_errno__INTERNAL__(std::string(200, 'r').c_str(), ENOENT, "f", "1", 19);
  EXPECT_EQ(detail.dae_error_string, std::string(79, 'r'));
  dae_detail_init__INTERNAL__(nullptr, "x");
  dae_detail_error__INTERNAL__("LOST", "f", "1", 20);
  EXPECT_EQ(all(), "a_routine_with_a_na|" + std::string(79, 'r') + "|f|1|19");
}

/// Reads the entry of a child that has run `body` and is stopped, or has ended in it.
int read_child(dae_procsinfo_t* entry, const std::function<void()>& body) {
  const pid_t child = fork();
  if (child == 0) {
    body();
    raise(SIGSTOP);
    _exit(0);
  }
  siginfo_t info;
  waitid(P_PID, static_cast<id_t>(child), &info, WSTOPPED | WEXITED | WNOWAIT);
  const int count = dae_getprocs(child, entry);
  kill(child, SIGKILL);
  waitpid(child, nullptr, 0);
  return count;
}

TEST(ProcessTable, Entries_say_what_a_process_is) {
  dae_procsinfo_t entry;
  for (const std::string name : {"a) Z (b 1 2", " x", "exactly15chars_and_more"}) {
    memset(&entry, 'x', sizeof entry);
    ASSERT_EQ(read_child(&entry, [&] { prctl(PR_SET_NAME, name.c_str()); }), 1);
    EXPECT_EQ(entry.pi_comm, name.substr(0, 15));
    EXPECT_EQ(entry.pi_state, DAE_PSTATE_STOP);
  }
  ASSERT_EQ(read_child(&entry, [] { setpgid(0, 0), static_cast<void>(seteuid(65534)); }), 1);
  EXPECT_EQ(entry.pi_ppid, static_cast<uint32_t>(getpid()));
  EXPECT_EQ(entry.pi_pgrp, entry.pi_pid);
  EXPECT_EQ(entry.pi_sid, static_cast<uint32_t>(getsid(0)));
  EXPECT_EQ(entry.pi_uid, getuid());
  ASSERT_EQ(read_child(&entry, [] { _exit(0); }), 1);
  EXPECT_EQ(entry.pi_state, DAE_PSTATE_ZOMB);
  ASSERT_EQ(dae_getprocs(getpid(), &entry), 1);
  EXPECT_EQ(entry.pi_state, DAE_PSTATE_ACTIVE);
  EXPECT_EQ(outcome([&] { return dae_getprocs(-5, &entry); }), "-1 open failed: No such file or directory");
  EXPECT_EQ(outcome([&] { return read_child(&entry, [] { prctl(PR_SET_NAME, ""); }); }),
            "-1 sscanf failed: Invalid argument");
}

TEST(Lock, Failures_are_named_and_a_set_that_goes_is_made_again) {
  char path[] = "/tmp/dae_lock_XXXXXX";
  close(mkstemp(path));
  const auto take = [&path](const char* file, char id, int removed = 0) {
    return outcome([=, &path] {
      removals = removed;
      const int code = dae_exclusive__INTERNAL__(file, id);
      semctl(semget(ftok(path, 'z'), 1, 0), 0, IPC_RMID);
      return code;
    });
  };
  EXPECT_EQ(take(nullptr, 'z'), "15 DAE_EM_EXCLINVALID");
  EXPECT_EQ(take(path, 0), "15 DAE_EM_EXCLINVALID");
  EXPECT_EQ(take("/no/such/file", 'z'), "16 ftok failed: No such file or directory");
  EXPECT_EQ(take(path, 'z', 2), "0 ");
  EXPECT_EQ(take(path, 'z', 3), "16 semop failed: Invalid argument");
  for (const mode_t mode : {0664, 0666}) {  // one that another user may take away, or change
    const int set = semget(ftok(path, 'y'), 1, IPC_CREAT | IPC_EXCL | 0664);
    semid_ds state = {};
    semctl(set, 0, IPC_STAT, &state);
    state.sem_perm.mode = mode;
    if (mode == 0664 && geteuid() == 0) state.sem_perm.uid = 65534;
    semctl(set, 0, IPC_SET, &state);
    if (mode == 0666 || geteuid() == 0) {
      EXPECT_EQ(take(path, 'y'), "16 DAE_EM_EXCLFOREIGN");
    }
    semctl(set, 0, IPC_RMID);
  }
  unlink(path);
  if (geteuid() != 0) GTEST_SKIP() << "the set of another user needs root; the rest was tested";
}

TEST(PagingSpace, Only_wishes_are_granted) {
  const int codes[] = {0, 0, 0, 12, 12, 13, 13};
  for (int policy = 0; policy < 7; ++policy) {
    EXPECT_EQ(dae_set_psalloc__INTERNAL__(static_cast<dae_psalloc_t>(policy), nullptr, nullptr), codes[policy]);
  }
}

TEST(Profile, Options_go_to_the_kinds_whose_bit_is_set) {
  dae_init_lowps(DAE_P_INETD | 64, handler, 8);
  for (int kind = DAE_I_MIN; kind <= DAE_I_MAX; ++kind) {
    const dae_per_parent_t& options = dae_prof__INTERNAL__.per_parent[kind];
    EXPECT_EQ(options.lowps_call + options.lowps_restart, kind == DAE_I_INETD ? 2u : 0u);
  }
}

TEST(Profile, A_transport_replaces_all_of_another_until_start_up_was_tried) {
  static const dae_req_sig_t handlers = {handler, handler, other_handler};
  static const dae_req_sock_t routines = {
      [] {}, [] {}, handler, handler,
      [] {}, [] {}, [] {},   [](short, short, short, const void*, int) { return 0; }};
  void (*const transports[])() = {[] { dae_init_KPL_sig(SIGUSR1, SIGUSR2, &handlers, 3); },
                                  [] { dae_init_KPL_msq(&descriptor, 77, 5, &routines, 2); },
                                  [] { dae_init_KPL_sock(&descriptor, &routines, 1); }};
  dae_profile_t& profile = dae_prof__INTERNAL__;
  dae_profile_t expected;
  const auto is_as_expected = [&] { return memcmp(&profile, &expected, sizeof profile) == 0; };
  descriptor = 9;
  for (const auto set : transports) {
    for (const auto set_other : transports) {
      memset(&profile, 0, sizeof profile);
      set();
      expected = profile;
      set_other();
      EXPECT_EQ(is_as_expected(), set == set_other);
      set();
      EXPECT_TRUE(is_as_expected());
      dae_pid__INTERNAL__ = set == transports[0] ? -1 : getpid();  // tried, in vain or not
      set_other();
      dae_init_keep_files_open(7);
      dae_init_KPL_sock_block();
      EXPECT_TRUE(is_as_expected());
      dae_pid__INTERNAL__ = 0;
    }
  }
  memset(&profile, 0, sizeof profile);
}

/// The refusal of a start, which says who is thought to be the parent.
std::string refusal(dae_parent_t mask, const std::function<void()>& before) {
  return outcome([&] {
    before();
    dae_parent_t parent = mask;
    const int code = dae_init(&parent, &detail);
    return parent == 0 ? code : -1;
  });
}

TEST(Start, Masks_out_of_range_and_second_calls_are_refused) {
  EXPECT_EQ(refusal(8, [] {}), "2 DAE_EM_PINVALID");
  const auto start_twice = [] {
    dae_init_KPL_sock(&descriptor, nullptr, 0);
    if (dae_init(nullptr, nullptr) != DAE_E_PINVALID) abort();
    descriptor = 7;
    dae_parent_t parent = 5;
    const int code = dae_init(&parent, &detail);
    return parent == 5 && descriptor == -1 && dae_prof__INTERNAL__.parent == 0 ? code : -1;
  };
  EXPECT_EQ(outcome(start_twice), "1 DAE_EM_NOTAGAIN");
}

TEST(Start, The_master_is_known_by_all_its_traits) {
  const struct {
    dae_procsinfo_t parent;
    const char* refusal;
  } cases[] = {{{0, 1, 0, 0, 0, DAE_PSTATE_ACTIVE, 0, 0, "kplmstr"}, "3 DAE_EM_PWRONG_KPL"},
               {{0, 1, 0, 0, 0, DAE_PSTATE_ACTIVE, 0, 0, "kplmstr2"}, "3 DAE_EM_PWRONG_OTHER"},
               {{0, 2, 0, 0, 0, DAE_PSTATE_ACTIVE, 0, 0, "kplmstr"}, "3 DAE_EM_PWRONG_OTHER"},
               {{0, 1, 1, 0, 0, DAE_PSTATE_ACTIVE, 0, 0, "kplmstr"}, "3 DAE_EM_PWRONG_OTHER"},
               {{0, 1, 0, 1, 0, DAE_PSTATE_ACTIVE, 0, 0, "kplmstr"}, "3 DAE_EM_PWRONG_OTHER"},
               {{0, 1, 0, 0, 1, DAE_PSTATE_ACTIVE, 0, 0, "kplmstr"}, "3 DAE_EM_PWRONG_OTHER"},
               {{0, 1, 0, 0, 0, DAE_PSTATE_ACTIVE, 0, 34816, "kplmstr"}, "3 DAE_EM_PWRONG_OTHER"},
               {{0, 1, 0, 0, 0, DAE_PSTATE_ZOMB, 0, 0, "kplmstr"}, "4 DAE_EM_PPROCENTRYSTATE"},
               {{1, 1, 0, 0, 0, DAE_PSTATE_ACTIVE, 0, 0, "kplmstr"}, "4 DAE_EM_PPROCENTRYPID"}};
  for (const auto& c : cases) EXPECT_EQ(refusal(DAE_P_INETD, [&] { parent_entry = c.parent; }), c.refusal);
}

/// Puts sockets on descriptors 0 to 2: for each the number of its socket, or none.
void place_sockets(const std::string& numbers) {
  sockaddr_in loopback = {};
  loopback.sin_family = AF_INET;
  loopback.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  for (const char number : {'1', '2'}) {
    const int made = socket(AF_INET, SOCK_DGRAM, 0);
    if (bind(made, reinterpret_cast<sockaddr*>(&loopback), sizeof loopback) != 0) abort();
    for (const int fd : {0, 1, 2}) numbers[static_cast<size_t>(fd)] == number ? dup2(made, fd) : 0;
  }
}

TEST(Start, The_super_server_is_known_by_three_sockets_on_one_address) {
  EXPECT_EQ(refusal(DAE_P_KPL, [] { place_sockets("111"); }), "3 DAE_EM_PWRONG_INETD");
  for (const char* numbers : {"1--", "11-", "112", "-11"}) {
    EXPECT_EQ(refusal(DAE_P_KPL, [=] { place_sockets(numbers); }), "3 DAE_EM_PWRONG_OTHER") << numbers;
  }
}

TEST(Start, A_process_that_can_lead_nothing_is_refused) {
  const auto start_in_foreign_group = [] {
    int ends[2];
    if (pipe(ends) != 0 || setpgid(0, 0) != 0) abort();
    if (fork() == 0) {  // as long as it is in the group, there can be no session of that number
      close(ends[1]);
      char byte;
      _exit(static_cast<int>(read(ends[0], &byte, 1)));
    }
    if (setpgid(0, getpgid(getppid())) != 0) abort();
    place_sockets("111");
    dae_parent_t parent = DAE_P_INETD;
    return dae_init(&parent, &detail);
  };
  EXPECT_EQ(outcome(start_in_foreign_group), "6 DAE_EM_SESSION");
}

/// Sets up the request channel with `prepare`d options.
std::string channel(const std::function<void()>& prepare) {
  return outcome([&] {
    prepare();
    const int code = dae_KPL_init__INTERNAL__(&descriptor);
    return code == 0 || descriptor == -1 ? code : -1;
  });
}

TEST(Channel, Signals_must_fit_their_handlers) {
  const std::string refused = "11 DAE_EM_KPL_SIG";
  const struct {
    int normal, forced;
    dae_req_sig_t handlers;
    std::string result;
  } cases[] = {{0, 0, {}, "0 "},
               {15, 15, {handler, handler, handler}, "0 "},
               {10, 10, {handler, handler, nullptr}, "0 "},
               {31, 0, {}, refused},
               {0, -1, {}, refused},
               {0, 0, {handler, nullptr, nullptr}, refused},
               {0, 0, {nullptr, handler, nullptr}, refused},
               {15, 0, {handler, nullptr, other_handler}, refused},
               {10, 15, {handler, nullptr, other_handler}, refused},
               {10, 10, {handler, other_handler, nullptr}, refused},
               {SIGKILL, 0, {handler, nullptr, nullptr}, "11 sigaction failed: Invalid argument"}};
  for (const auto& c : cases) {
    EXPECT_EQ(channel([&] { dae_init_KPL_sig(c.normal, c.forced, &c.handlers, 1); }), c.result)
        << c.normal << " " << c.forced;
  }
}

TEST(Channel, Signal_actions_are_installed_as_asked) {
  const FreshOutput result = in_fresh_process([] {
    const dae_req_sig_t handlers = {handler, nullptr, other_handler};
    dae_init_KPL_sig(SIGUSR1, SIGUSR2, &handlers, 1);
    if (dae_KPL_init__INTERNAL__(nullptr) != 0) abort();
    for (const int signo : {SIGUSR1, SIGTERM}) {
      struct sigaction action;
      sigaction(signo, nullptr, &action);
      printf("%d%d%d%d ", action.sa_handler == (signo == SIGTERM ? other_handler : handler),
             (action.sa_flags & SA_RESTART) != 0, sigismember(&action.sa_mask, SIGUSR1),
             sigismember(&action.sa_mask, SIGUSR2));
    }
    fflush(nullptr);
    atexit(abort);  // the missing handler ends the process without exit handlers
    raise(SIGUSR2);
    abort();
  });
  EXPECT_EQ(result.out, "1111 1111 ");
  EXPECT_EQ(result.status, 0);
}

/// Wants descriptor 0, which is a socket, as `wanted`.
void use_socket(int wanted) {
  descriptor = wanted;
  int ends[2];
  if (socketpair(AF_UNIX, SOCK_DGRAM, 0, ends) != 0) abort();
  dup2(ends[0], 0);
  dae_init_KPL_sock(&descriptor, nullptr, 0);
}

TEST(Channel, Sockets_go_where_they_are_wanted) {
  if (geteuid() != 0 && getegid() != 0) GTEST_SKIP() << "the socket transport is for root";
  for (const int wanted : {0, 2}) EXPECT_EQ(channel([=] { use_socket(wanted); }), "11 DAE_EM_KPL_SOCK_FD");
  EXPECT_EQ(channel([] { use_socket(77), dup2(0, 77); }), "11 DAE_EM_KPL_SOCK_DUP");
  EXPECT_EQ(channel([] { use_socket(-1), dup2(open("/dev/null", O_RDWR), 0); }),
            "11 getsockname failed: Socket operation on non-socket");
  for (const bool block : {false, true}) {
    EXPECT_EQ(outcome([=] {
                if (block) dae_init_KPL_sock_block();
                use_socket(block ? 77 : -1);  // leaves that as it is
                dae_KPL_init__INTERNAL__(&descriptor);
                return (block ? descriptor == 77 : descriptor > 2) && fcntl(0, F_GETFD) == -1 &&
                       fcntl(descriptor, F_GETFD) == FD_CLOEXEC &&
                       (fcntl(descriptor, F_GETFL) & O_NONBLOCK) == (block ? 0 : O_NONBLOCK);
              }),
              "1 ");
  }
}

TEST(Channel, Queues_must_exist_and_give_only_requests_of_their_type) {
  if (geteuid() != 0 && getegid() != 0) GTEST_SKIP() << "the queue transport is for root";
  const int key = getpid() << 8 | 'q';
  const auto serve_both = [key] {
    static int refreshed;
    dae_req_msq_t routines = {};
    routines.dae_refresh = [] { ++refreshed; };
    dae_init_KPL_msq(nullptr, key, 9, &routines, 0);
    if (const int code = dae_KPL_init__INTERNAL__(&descriptor); code != 0) return code;
    dae_pid__INTERNAL__ = getpid();
    kplreq request = {};
    request.subreq.object = KPL_OBJECT_SUBSYSTEM;
    request.subreq.action = KPL_ACTION_REFRESH;
    for (request.mtype = 8; request.mtype <= 9; ++request.mtype) {
      msgsnd(descriptor, &request, sizeof request - sizeof request.mtype, 0);
    }
    for (int i = 0; i < 2; ++i) dae_KPL_req();
    return -refreshed;
  };
  EXPECT_EQ(outcome(serve_both), "11 msgget failed: No such file or directory");
  const int queue = msgget(key, IPC_CREAT | IPC_EXCL | 0660);
  EXPECT_EQ(outcome(serve_both), "-1 ");
  msgctl(queue, IPC_RMID, nullptr);
  EXPECT_EQ(channel([] { dae_prof__INTERNAL__.KPL_comm = static_cast<dae_KPL_comm_t>(3); }), "11 DAE_EM_KPL_COMM");
}

TEST(Channel, Either_effective_id_of_root_is_enough) {
  if (geteuid() != 0 || getegid() != 0) GTEST_SKIP() << "needs root to give it up";
  constexpr unsigned kNobody = 65534;
  const auto as = [](gid_t gid, uid_t uid, bool queue = false) {
    return channel([=] {
      if (setegid(gid) != 0 || seteuid(uid) != 0) abort();
      queue ? dae_init_KPL_msq(nullptr, 1, 1, nullptr, 0) : use_socket(-1);
    });
  };
  EXPECT_EQ(as(kNobody, 0), "0 ");
  EXPECT_EQ(as(0, kNobody), "0 ");
  EXPECT_EQ(as(kNobody, kNobody), "11 DAE_EM_KPL_SOCK_PERM");
  EXPECT_EQ(as(kNobody, kNobody, true), "11 DAE_EM_KPL_MSQ_PERM");
}

}  // namespace
