#include "platform/background/BackgroundActivity.h"

namespace larder {

std::string_view toString(BackgroundActivityState state) {
  switch (state) {
    case BackgroundActivityState::Waiting:
      return "waiting";
    case BackgroundActivityState::Deferred:
      return "deferred";
    case BackgroundActivityState::Run:
      return "run";
    case BackgroundActivityState::Done:
      return "done";
  }
  return "unknown";
}

}  // namespace larder
