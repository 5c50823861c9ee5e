// Noise in the schedule: while it is on, threads dawdle at random before they lock a mutex.
//
// The windows in which a wake-up can be lost are a few instructions wide; this makes them wide enough to be hit.
// The test program replaces pthread_mutex_lock for that, which the sanitizers, who replace it too, do not allow:
// there the noise is silent.
#ifndef TESTS_GSCL_THREAD_NOISE_H
#define TESTS_GSCL_THREAD_NOISE_H

class Noise {
 public:
  Noise();
  ~Noise();
  Noise(const Noise&) = delete;
  Noise& operator=(const Noise&) = delete;
};

#endif
