// Coordination of saves and loads inside the host process. The staging
// directory has one fixed path, so two saves must never interleave; and while
// a save swaps the staging directory in, the live directory briefly does not
// exist, so loads wait for the swap instead of failing.
#ifndef TC_CONFLOCK_H
#define TC_CONFLOCK_H

#include <mutex>
#include <shared_mutex>

namespace conflock {

// Held by a save from its staging copy until the staging directory is gone.
// Taken before Live() whenever both are held.
std::mutex& Staging();
// Held exclusively by a save while it replaces the live directory, shared by
// loads while they read rules from it.
std::shared_mutex& Live();

// A load's hold on the live directory for as long as it reads from it.
class LiveReader {
 public:
  LiveReader() : lock_(Live()) {}

 private:
  std::shared_lock<std::shared_mutex> lock_;
};

}  // namespace conflock

#endif
