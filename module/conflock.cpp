#include "conflock.h"

#include <stdlib.h>

namespace conflock {

WriterFirstLock::WriterFirstLock() {
  pthread_rwlockattr_t attr;
  pthread_rwlockattr_init(&attr);
  pthread_rwlockattr_setkind_np(&attr, PTHREAD_RWLOCK_PREFER_WRITER_NONRECURSIVE_NP);
  // Only fails for lack of resources at start-up; running without the lock
  // would silently lose its guarantees.
  if (pthread_rwlock_init(&lock_, &attr) != 0) abort();
  pthread_rwlockattr_destroy(&attr);
}

WriterFirstLock::~WriterFirstLock() { pthread_rwlock_destroy(&lock_); }

void WriterFirstLock::lock() { pthread_rwlock_wrlock(&lock_); }
void WriterFirstLock::unlock() { pthread_rwlock_unlock(&lock_); }
void WriterFirstLock::lock_shared() { pthread_rwlock_rdlock(&lock_); }
void WriterFirstLock::unlock_shared() { pthread_rwlock_unlock(&lock_); }

std::mutex& Staging() {
  static std::mutex staging;
  return staging;
}

WriterFirstLock& Live() {
  static WriterFirstLock live;
  return live;
}

}  // namespace conflock
