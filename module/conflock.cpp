#include "conflock.h"

namespace conflock {

std::mutex& Staging() {
  static std::mutex staging;
  return staging;
}

std::shared_mutex& Live() {
  static std::shared_mutex live;
  return live;
}

}  // namespace conflock
