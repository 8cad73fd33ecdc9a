#include "conflock.h"

namespace conflock {

// A static initializer cannot fail, so there is no error path to handle.
WriterFirstLock::WriterFirstLock() : lock_(PTHREAD_RWLOCK_WRITER_NONRECURSIVE_INITIALIZER_NP) {}

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
