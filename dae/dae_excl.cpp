// The single-instance lock: a System V semaphore that is 1 while the daemon lives.
#include <stdlib.h>
#include <sys/ipc.h>
#include <sys/sem.h>
#include <sys/stat.h>
#include <unistd.h>

#include "dae/dae_failure_internal.h"

namespace {

constexpr int kAttempts = 3;

int sem_ID = -1;

/// Waits for nobody: from 0 to 1 in one step, or not at all. The kernel takes the 1 back however the process ends.
int take_semaphore() {
  sembuf steps[] = {{0, 0, IPC_NOWAIT}, {0, 1, SEM_UNDO}};
  int result;
  do {
    result = semop(sem_ID, steps, 2);
  } while (result != 0 && errno == EINTR);
  return result;
}

/// Whether nobody but root and this process's user can take the set away, and nobody but they and members of its
/// group can change it. False with errno 0 when somebody can.
bool is_ours() {
  semid_ds set;
  union {
    int val;
    semid_ds* buf;
  } argument = {};
  argument.buf = &set;
  if (semctl(sem_ID, 0, IPC_STAT, argument) != 0) return false;
  errno = 0;
  const auto is_trusted = [](uid_t user) { return user == 0 || user == geteuid(); };
  return is_trusted(set.sem_perm.uid) && is_trusted(set.sem_perm.cuid) && (set.sem_perm.mode & S_IWOTH) == 0;
}

}  // namespace

int dae_exclusive__INTERNAL__(const char* excl_path, char excl_ID) {
  if (excl_path == nullptr || excl_ID == 0) return dae::fail(DAE_E_EXCLINVALID, "DAE_EM_EXCLINVALID");
  const key_t key = ftok(excl_path, excl_ID);
  if (key == -1) return dae::fail_call(DAE_E_EXCLFAILED, "ftok");

  // A holder that ends removes the set, maybe just between our two calls: then there is a new one to be made.
  for (int attempt = 1;; ++attempt) {
    sem_ID = semget(key, 1, IPC_CREAT | 0664);
    if (sem_ID == -1) return dae::fail_call(DAE_E_EXCLFAILED, "semget");
    const bool ours = is_ours();
    if (!ours && errno == 0) return dae::fail(DAE_E_EXCLFAILED, "DAE_EM_EXCLFOREIGN");
    if (ours && take_semaphore() == 0) break;
    if (errno == EAGAIN) return dae::fail(DAE_E_EXCLBUSY, "DAE_EM_EXCLBUSY");
    const bool removed = errno == EINVAL || errno == EIDRM;
    if (!removed || attempt == kAttempts) return dae::fail_call(DAE_E_EXCLFAILED, ours ? "semop" : "semctl");
  }
  atexit(dae_release);
  return DAE_OK;
}

void dae_release() {
  if (dae_process_is_the_daemon()) semctl(sem_ID, 0, IPC_RMID);
}
