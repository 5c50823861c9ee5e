// The small services of the daemon environment, and everything of start-up that needs no daemon.
#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ipc.h>
#include <sys/prctl.h>
#include <sys/sem.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <functional>
#include <string>

#include "../support/fresh_process.h"
#include "dae/dae_internal.h"

namespace {

using testing::StartsWith;

/// A child that runs `body` and then waits to be killed; gone with the object.
class Child {
 public:
  explicit Child(const std::function<void()>& body) {
    int ends[2];
    if (pipe(ends) != 0) abort();
    pid_ = fork();
    if (pid_ == 0) {
      body();
      if (write(ends[1], "", 1) != 1) abort();
      for (;;) pause();
    }
    char byte;
    close(ends[1]);
    EXPECT_EQ(read(ends[0], &byte, 1), 1);
    close(ends[0]);
  }
  ~Child() { end(SIGKILL); }
  Child(const Child&) = delete;
  Child& operator=(const Child&) = delete;

  pid_t pid() const { return pid_; }
  void end(int signo) {
    if (pid_ == 0) return;
    kill(pid_, signo);
    waitpid(pid_, nullptr, 0);
    pid_ = 0;
  }

 private:
  pid_t pid_;
};

TEST(ErrorDetail, Fields_are_cut_and_the_last_error_stays) {
  dae_error_detail_t detail;
  memset(&detail, 'x', sizeof detail);
  dae_detail_init__INTERNAL__(&detail, "a_routine_with_a_name_too_long");
  EXPECT_STREQ(detail.dae_routine, "a_routine_with_a_na");
  EXPECT_STREQ(detail.dae_error_string, "");
  EXPECT_STREQ(detail.dae_filename, "");
  EXPECT_STREQ(detail.dae_fileversion, "");
  EXPECT_EQ(dae_detail_is_set__INTERNAL__(), 0);

  dae_detail_error__INTERNAL__("FIRST", "/a/folder/with.d/a_file_name_that_is_long.cpp", "1.2.3.4.5.6", 17);
  EXPECT_EQ(dae_detail_is_set__INTERNAL__(), 1);
  EXPECT_STREQ(detail.dae_filename, "a_file_name_that_is");
  EXPECT_STREQ(detail.dae_fileversion, "1.2.3.4.5");
  EXPECT_EQ(detail.dae_fileline, 17);
  dae_detail_errno__INTERNAL__("open", ENOENT, "plain.cpp", "1", 18);
  EXPECT_STREQ(detail.dae_error_string, "open failed: No such file or directory");
  EXPECT_STREQ(detail.dae_filename, "plain.cpp");
  dae_detail_errno__INTERNAL__(std::string(200, 'r').c_str(), ENOENT, "f", "1", 19);
  EXPECT_EQ(detail.dae_error_string, std::string(79, 'r'));

  dae_detail_init__INTERNAL__(nullptr, "x");
  dae_detail_error__INTERNAL__("LOST", "f", "1", 20);
  EXPECT_EQ(dae_detail_is_set__INTERNAL__(), 0);
  EXPECT_EQ(detail.dae_fileline, 19);
}

TEST(ProcessTable, Own_entry_is_true) {
  dae_procsinfo_t entry;
  ASSERT_EQ(dae_getprocs(getpid(), &entry), 1);
  EXPECT_EQ(entry.pi_pid, static_cast<uint32_t>(getpid()));
  EXPECT_EQ(entry.pi_ppid, static_cast<uint32_t>(getppid()));
  EXPECT_EQ(entry.pi_sid, static_cast<uint32_t>(getsid(0)));
  EXPECT_EQ(entry.pi_pgrp, static_cast<uint32_t>(getpgrp()));
  EXPECT_EQ(entry.pi_uid, getuid());
  EXPECT_EQ(entry.pi_state, DAE_PSTATE_ACTIVE);
}

TEST(ProcessTable, Names_and_states_are_read_from_what_proc_shows) {
  dae_procsinfo_t entry;
  {
    Child child([] { prctl(PR_SET_NAME, "a) Z (b 1 2"); });
    ASSERT_EQ(dae_getprocs(child.pid(), &entry), 1);
    EXPECT_STREQ(entry.pi_comm, "a) Z (b 1 2");
    EXPECT_EQ(entry.pi_state, DAE_PSTATE_ACTIVE);
    EXPECT_EQ(entry.pi_ppid, static_cast<uint32_t>(getpid()));
    kill(child.pid(), SIGSTOP);
    waitpid(child.pid(), nullptr, WUNTRACED);
    ASSERT_EQ(dae_getprocs(child.pid(), &entry), 1);
    EXPECT_EQ(entry.pi_state, DAE_PSTATE_STOP);
    kill(child.pid(), SIGKILL);
    siginfo_t info;
    waitid(P_PID, static_cast<id_t>(child.pid()), &info, WEXITED | WNOWAIT);
    ASSERT_EQ(dae_getprocs(child.pid(), &entry), 1);
    EXPECT_EQ(entry.pi_state, DAE_PSTATE_ZOMB);
  }
  Child leader([] {
    setsid();
    prctl(PR_SET_NAME, "exactly15chars_and_more");
  });
  ASSERT_EQ(dae_getprocs(leader.pid(), &entry), 1);
  EXPECT_STREQ(entry.pi_comm, "exactly15chars_");
  EXPECT_EQ(entry.pi_sid, entry.pi_pid);
  EXPECT_EQ(entry.pi_pgrp, entry.pi_pid);
  EXPECT_EQ(entry.pi_ttyp, 0u);
}

TEST(ProcessTable, Failures_name_their_step) {
  dae_error_detail_t detail;
  dae_procsinfo_t entry;
  dae_detail_init__INTERNAL__(&detail, "test");
  EXPECT_EQ(dae_getprocs(-5, &entry), -1);
  EXPECT_STREQ(detail.dae_error_string, "open failed: No such file or directory");
  Child nameless([] { prctl(PR_SET_NAME, ""); });
  EXPECT_EQ(dae_getprocs(nameless.pid(), &entry), -1);
  EXPECT_STREQ(detail.dae_error_string, "sscanf failed: Invalid argument");
  EXPECT_STREQ(detail.dae_filename, "dae_getprocs.cpp");
  dae_detail_init__INTERNAL__(nullptr, "");
}

/// A file to lock by; the semaphore set that may be left is removed.
class Lock : public testing::Test {
 protected:
  static constexpr char kId = 'z';

  Lock() { close(mkstemp(path_)); }
  ~Lock() override {
    const int id = find();
    if (id != -1) semctl(id, 0, IPC_RMID);
    unlink(path_);
  }

  int find() const { return semget(ftok(path_, kId), 1, 0); }

  /// A process that took the lock and counts as the daemon.
  void take_as_daemon() const {
    dae_pid__INTERNAL__ = getpid();
    if (dae_exclusive__INTERNAL__(path_, kId) != 0) abort();
  }

  /// What a process gets that tries, and then exits with its handlers.
  int try_and_exit() const {
    const pid_t child = fork();
    if (child == 0) {
      const int code = dae_exclusive__INTERNAL__(path_, kId);
      dae_pid__INTERNAL__ = code == 0 ? getpid() : -1;
      exit(code);
    }
    int status = -1;
    waitpid(child, &status, 0);
    return WEXITSTATUS(status);
  }

  char path_[32] = "/tmp/dae_lock_XXXXXX";
};

TEST_F(Lock, One_holder_at_a_time_and_a_crash_frees_it) {
  Child holder([this] { take_as_daemon(); });
  EXPECT_EQ(try_and_exit(), DAE_E_EXCLBUSY);
  EXPECT_EQ(try_and_exit(), DAE_E_EXCLBUSY);  // the refused one has removed nothing
  holder.end(SIGKILL);
  EXPECT_NE(find(), -1);
  EXPECT_EQ(try_and_exit(), 0);
  EXPECT_EQ(find(), -1);  // a normal exit removes the set
}

TEST_F(Lock, A_child_of_the_daemon_does_not_remove_it) {
  Child holder([this] {
    take_as_daemon();
    const pid_t child = fork();
    if (child == 0) exit(0);  // with the handlers that it inherited
    waitpid(child, nullptr, 0);
  });
  EXPECT_NE(find(), -1);
  EXPECT_EQ(try_and_exit(), DAE_E_EXCLBUSY);
}

TEST_F(Lock, Failures_are_named) {
  dae_error_detail_t detail;
  dae_detail_init__INTERNAL__(&detail, "test");
  EXPECT_EQ(dae_exclusive__INTERNAL__(nullptr, 'a'), DAE_E_EXCLINVALID);
  EXPECT_EQ(dae_exclusive__INTERNAL__(path_, 0), DAE_E_EXCLINVALID);
  EXPECT_STREQ(detail.dae_error_string, "DAE_EM_EXCLINVALID");
  EXPECT_EQ(dae_exclusive__INTERNAL__("/no/such/file", 'a'), DAE_E_EXCLFAILED);
  EXPECT_STREQ(detail.dae_error_string, "ftok failed: No such file or directory");
  const int two = semget(ftok(path_, kId), 2, IPC_CREAT | 0600);
  semop(two, std::array<sembuf, 1>{{{0, 1, 0}}}.data(), 1);
  EXPECT_EQ(dae_exclusive__INTERNAL__(path_, kId), DAE_E_EXCLBUSY);
  EXPECT_STREQ(detail.dae_error_string, "DAE_EM_EXCLBUSY");
  dae_detail_init__INTERNAL__(nullptr, "");
}

TEST(PagingSpace, Only_wishes_are_granted) {
  const auto check = [](int policy) {
    return dae_set_psalloc__INTERNAL__(static_cast<dae_psalloc_t>(policy), nullptr, nullptr);
  };
  EXPECT_EQ(check(DAE_A_DONT_CARE) + check(DAE_A_LATE_TRY) + check(DAE_A_EARLY_TRY), 0);
  EXPECT_EQ(check(DAE_A_LATE), DAE_E_NOPSALLOC);
  EXPECT_EQ(check(DAE_A_EARLY), DAE_E_NOPSALLOC);
  EXPECT_EQ(check(DAE_A_INVALID), DAE_E_AINVALID);
  EXPECT_EQ(check(99), DAE_E_AINVALID);
}

void handler(int) {}
void other_handler(int) {}

class Profile : public testing::Test {
 protected:
  Profile() { prof = {}; }
  ~Profile() override {
    prof = {};
    dae_pid__INTERNAL__ = 0;
  }
  dae_profile_t& prof = dae_prof__INTERNAL__;
};

TEST_F(Profile, Options_go_to_the_kinds_whose_bit_is_set) {
  const char* argv[] = {"prog", nullptr};
  dae_init_psalloc(5 | 64, DAE_A_LATE, "/prog", argv);
  dae_init_lowps(2, handler, 8);
  dae_init_prevent_zombies(4, -2);
  dae_init_exclusive(1, "/path", 'i');
  dae_init_keep_files_open(6);
  for (const int kind : {DAE_I_KPL, DAE_I_INETD, DAE_I_OTHER}) {
    const dae_per_parent_t& options = prof.per_parent[kind];
    EXPECT_EQ(options.psalloc_call, kind != DAE_I_INETD);
    EXPECT_EQ(options.argv, kind != DAE_I_INETD ? argv : nullptr);
    EXPECT_EQ(options.lowps_call, kind == DAE_I_INETD);
    EXPECT_EQ(options.lowps_restart, kind == DAE_I_INETD);  // whether it is not 0
    EXPECT_EQ(options.pzomb_call, kind == DAE_I_OTHER);
    EXPECT_EQ(options.pzomb_restart, kind == DAE_I_OTHER);
    EXPECT_EQ(options.pzomb_hdl != nullptr, kind == DAE_I_OTHER);
    EXPECT_EQ(options.excl_call, kind == DAE_I_KPL);
    EXPECT_EQ(options.excl_ID, kind == DAE_I_KPL ? 'i' : '\0');
    EXPECT_EQ(options.keep_open_call, kind != DAE_I_KPL);
  }
  dae_init_lowps(2, nullptr, 0);
  EXPECT_EQ(prof.per_parent[DAE_I_INETD].lowps_restart, 0u);
}

TEST_F(Profile, A_transport_replaces_all_of_the_one_before) {
  int descriptor = 9;
  dae_req_sock_t routines = {};
  routines.dae_refresh = [] {};
  routines.dae_stop_cancel = handler;
  dae_init_KPL_sock(&descriptor, &routines, 1);
  dae_init_KPL_sock_block();
  EXPECT_EQ(prof.KPL_comm, DAE_C_SOCK);
  EXPECT_EQ(prof.KPL_sockd, 9);
  EXPECT_EQ(prof.KPL_d_ptr, &descriptor);
  EXPECT_NE(prof.refresh, nullptr);
  EXPECT_EQ(prof.stop_cancel_hdl, handler);

  dae_init_term_sig(other_handler, 3);
  EXPECT_EQ(prof.KPL_comm, DAE_C_SIG);
  EXPECT_EQ(prof.sig_stop_normal, SIGTERM);
  EXPECT_EQ(prof.sig_stop_forced, SIGTERM);
  EXPECT_EQ(prof.stop_normal_hdl, other_handler);
  EXPECT_EQ(prof.stop_cancel_hdl, other_handler);
  EXPECT_EQ(prof.stop_restart, 3);
  EXPECT_EQ(prof.refresh, nullptr);
  EXPECT_EQ(prof.KPL_sockd, 0);
  EXPECT_EQ(prof.KPL_d_ptr, nullptr);

  dae_init_KPL_msq(&descriptor, 77, 5, nullptr, 0);
  EXPECT_EQ(prof.sig_stop_normal, 0);
  EXPECT_EQ(prof.stop_normal_hdl, nullptr);
  EXPECT_EQ(prof.msqkey, 77);
  EXPECT_EQ(prof.msqtype, 5);
  EXPECT_EQ(prof.KPL_d_ptr, &descriptor);
  EXPECT_EQ(prof.KPL_sockd_block, 1);  // only this stays
}

TEST_F(Profile, Nothing_changes_once_start_up_was_tried) {
  for (const pid_t outcome : {-1, getpid()}) {
    dae_pid__INTERNAL__ = outcome;
    const dae_profile_t before = prof;
    int descriptor = 5;
    dae_init_psalloc(7, DAE_A_LATE, "x", nullptr);
    dae_init_lowps(7, handler, 1);
    dae_init_prevent_zombies(7, 1);
    dae_init_exclusive(7, "x", 'x');
    dae_init_keep_files_open(7);
    dae_init_term_sig(handler, 1);
    dae_init_KPL_msq(&descriptor, 1, 1, nullptr, 1);
    dae_init_KPL_sock(&descriptor, nullptr, 1);
    dae_init_KPL_sock_block();
    EXPECT_EQ(memcmp(&before, &prof, sizeof prof), 0);
  }
}

/// The result of `step` in a fresh process, its detail, and what else it wrote.
std::string outcome(const std::function<int()>& step) {
  return in_fresh_process([&] {
           dae_error_detail_t detail;
           dae_detail_init__INTERNAL__(&detail, "test");
           const int code = step();
           printf("%d %s", code, detail.dae_error_string);
         })
      .out;
}

std::string start(
    dae_parent_t* parent, const std::function<void()>& before = [] {}) {
  return in_fresh_process([&] {
           before();
           dae_error_detail_t detail;
           errno = EDOM;
           const int code = dae_init(parent, &detail);
           printf("%d %s%s", code, detail.dae_error_string, errno == EDOM ? "" : " errno changed");
         })
      .out;
}

TEST(Start, Masks_out_of_range_are_refused) {
  for (const int mask : {0, 8, 15, -1}) {
    dae_parent_t parent = mask;
    EXPECT_EQ(start(&parent), "2 DAE_EM_PINVALID");
  }
  EXPECT_EQ(start(nullptr), "2 DAE_EM_PINVALID");
}

TEST(Start, A_parent_that_is_not_acceptable_is_refused_and_named) {
  dae_parent_t parent = DAE_P_KPL | DAE_P_INETD;
  EXPECT_EQ(start(&parent), "3 DAE_EM_PWRONG_OTHER");
  const auto named_like_it = [] { prctl(PR_SET_NAME, "kplmstr"); };
  dae_parent_t kpl = DAE_P_KPL;
  named_like_it();  // this process is the parent; the name alone does not make it the master
  EXPECT_EQ(start(&kpl), "3 DAE_EM_PWRONG_OTHER");
}

TEST(Start, A_second_call_is_refused_whatever_the_first_one_gave) {
  EXPECT_EQ(in_fresh_process([] {
              int descriptor = 7;
              dae_init_KPL_sock(&descriptor, nullptr, 0);
              dae_parent_t parent = 0;
              dae_init(&parent, nullptr);
              descriptor = 7;
              parent = 5;
              dae_error_detail_t detail;
              const int code = dae_init(&parent, &detail);
              printf("%d %s %d %d %d %s", code, detail.dae_error_string, parent, dae_prof__INTERNAL__.parent,
                     descriptor, detail.dae_routine);
            }).out,
            "1 DAE_EM_NOTAGAIN 5 0 -1 dae_init");
}

/// Sets up the request channel with `prepare`d options.
std::string channel(const std::function<void()>& prepare) {
  return outcome([&] {
    prepare();
    int descriptor = 5;
    const int code = dae_KPL_init__INTERNAL__(&descriptor);
    if (code != 0 && descriptor != -1) printf("descriptor %d ", descriptor);
    return code;
  });
}

void use_socket(int wanted) {
  static int descriptor;
  descriptor = wanted;
  dae_init_KPL_sock(&descriptor, nullptr, 0);
}

void put_socket_on_0() {
  int ends[2];
  if (socketpair(AF_UNIX, SOCK_DGRAM, 0, ends) != 0) abort();
  dup2(ends[0], 0);
}

TEST(Channel, Signals_must_fit_their_handlers) {
  const auto use = [](int normal, int forced, dae_req_sig_t handlers) {
    return channel([=] { dae_init_KPL_sig(normal, forced, &handlers, 1); });
  };
  const std::string refused = "11 DAE_EM_KPL_SIG";
  EXPECT_EQ(use(0, 0, {}), "0 ");
  EXPECT_EQ(use(15, 15, {handler, handler, handler}), "0 ");
  EXPECT_EQ(use(10, 10, {handler, handler, nullptr}), "0 ");
  EXPECT_EQ(use(30, 12, {handler, nullptr, other_handler}), "0 ");
  EXPECT_EQ(use(31, 0, {}), refused);
  EXPECT_EQ(use(0, -1, {}), refused);
  EXPECT_EQ(use(0, 0, {handler, nullptr, nullptr}), refused);
  EXPECT_EQ(use(0, 0, {nullptr, handler, nullptr}), refused);
  EXPECT_EQ(use(15, 0, {handler, nullptr, other_handler}), refused);
  EXPECT_EQ(use(10, 15, {handler, nullptr, other_handler}), refused);
  EXPECT_EQ(use(10, 10, {handler, other_handler, nullptr}), refused);
  EXPECT_EQ(use(SIGKILL, 0, {handler, nullptr, nullptr}), "11 sigaction failed: Invalid argument");
}

TEST(Channel, Signal_actions_are_installed_as_asked) {
  const FreshOutput result = in_fresh_process([] {
    const dae_req_sig_t handlers = {handler, nullptr, other_handler};
    dae_init_KPL_sig(SIGUSR1, SIGUSR2, &handlers, 1);
    if (dae_KPL_init__INTERNAL__(nullptr) != 0) abort();
    struct sigaction action;
    sigaction(SIGUSR1, nullptr, &action);
    printf("%d%d%d%d ", action.sa_handler == handler, (action.sa_flags & SA_RESTART) != 0,
           sigismember(&action.sa_mask, SIGUSR1), sigismember(&action.sa_mask, SIGUSR2));
    sigaction(SIGTERM, nullptr, &action);
    printf("%d%d", action.sa_handler == other_handler, sigismember(&action.sa_mask, SIGUSR2));
    atexit([] { abort(); });  // the missing handler ends the process without exit handlers
    fflush(nullptr);
    raise(SIGUSR2);
    abort();
  });
  EXPECT_EQ(result.out, "1111 11");
  EXPECT_EQ(result.status, 0);
}

TEST(Channel, Sockets_go_where_they_are_wanted) {
  if (geteuid() != 0 && getegid() != 0) GTEST_SKIP() << "the socket transport is for root";
  EXPECT_EQ(channel([] {
              put_socket_on_0();
              use_socket(77);
            }),
            "0 ");
  EXPECT_EQ(outcome([] {
              put_socket_on_0();
              use_socket(-1);
              int fd = -1;
              dae_KPL_init__INTERNAL__(&fd);
              return fd >= 3 && (fcntl(fd, F_GETFL) & O_NONBLOCK) && (fcntl(fd, F_GETFD) & FD_CLOEXEC) &&
                     fcntl(0, F_GETFD) == -1;
            }),
            "1 ");
  EXPECT_EQ(outcome([] {
              put_socket_on_0();
              dae_init_KPL_sock_block();
              use_socket(-1);
              int fd = -1;
              dae_KPL_init__INTERNAL__(&fd);
              return fcntl(fd, F_GETFL) & O_NONBLOCK;
            }),
            "0 ");
  for (const int wanted : {0, 2}) {
    EXPECT_EQ(channel([&] {
                put_socket_on_0();
                use_socket(wanted);
              }),
              "11 DAE_EM_KPL_SOCK_FD");
  }
  EXPECT_EQ(channel([] {
              put_socket_on_0();
              dup2(0, 77);
              use_socket(77);
            }),
            "11 DAE_EM_KPL_SOCK_DUP");
  EXPECT_EQ(channel([] {
              dup2(open("/dev/null", O_RDWR), 0);
              use_socket(-1);
            }),
            "11 getsockname failed: Socket operation on non-socket");
}

TEST(Channel, Queues_must_exist_and_transports_be_known) {
  if (geteuid() != 0 && getegid() != 0) GTEST_SKIP() << "the queue transport is for root";
  EXPECT_EQ(channel([] { dae_init_KPL_msq(nullptr, 0x7a6e0001, 1, nullptr, 0); }),
            "11 msgget failed: No such file or directory");
  EXPECT_EQ(channel([] { dae_prof__INTERNAL__.KPL_comm = static_cast<dae_KPL_comm_t>(3); }), "11 DAE_EM_KPL_COMM");
}

TEST(Channel, Either_effective_id_of_root_is_enough) {
  if (geteuid() != 0 || getegid() != 0) GTEST_SKIP() << "needs root to give it up";
  constexpr unsigned kNobody = 65534;
  const auto as = [&](gid_t gid, uid_t uid) {
    return channel([=] {
      if (setegid(gid) != 0 || seteuid(uid) != 0) abort();
      put_socket_on_0();
      use_socket(-1);
    });
  };
  EXPECT_EQ(as(kNobody, 0), "0 ");
  EXPECT_EQ(as(0, kNobody), "0 ");
  EXPECT_EQ(as(kNobody, kNobody), "11 DAE_EM_KPL_SOCK_PERM");
  EXPECT_EQ(channel([] {
              if (setegid(kNobody) != 0 || seteuid(kNobody) != 0) abort();
              dae_init_KPL_msq(nullptr, 1, 1, nullptr, 0);
            }),
            "11 DAE_EM_KPL_MSQ_PERM");
}

}  // namespace
