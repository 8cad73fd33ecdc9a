// Coordination of saves and loads inside the host process. The staging
// directory has one fixed path, so two saves must never interleave; and while
// a save swaps the staging directory in, the live directory briefly does not
// exist, so loads wait for the swap instead of failing.
#ifndef TC_CONFLOCK_H
#define TC_CONFLOCK_H

#include <pthread.h>

#include <mutex>
#include <shared_mutex>

namespace conflock {

// A reader/writer lock that lets a waiting writer in before new readers, so a
// steady stream of loads can never hold a save off for good (glibc's default,
// and so std::shared_mutex, prefers readers).
class WriterFirstLock {
 public:
  WriterFirstLock();
  ~WriterFirstLock();
  WriterFirstLock(const WriterFirstLock&) = delete;
  WriterFirstLock& operator=(const WriterFirstLock&) = delete;

  void lock();
  void unlock();
  void lock_shared();
  void unlock_shared();

 private:
  pthread_rwlock_t lock_;
};

// Held by a save from its staging copy until the staging directory is gone.
// Taken before Live() whenever both are held.
std::mutex& Staging();
// Held exclusively by a save while it replaces the live directory, shared by
// loads while they read rules from it.
WriterFirstLock& Live();

// A load's hold on the live directory for as long as it reads from it.
class LiveReader {
 public:
  LiveReader() : lock_(Live()) {}

 private:
  std::shared_lock<WriterFirstLock> lock_;
};

}  // namespace conflock

#endif
