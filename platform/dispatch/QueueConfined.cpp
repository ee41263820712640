#include "platform/dispatch/QueueConfined.h"

#include <cstdio>
#include <cstdlib>

namespace larder {

void queueConfinementViolated(const std::string& label) {
  std::fprintf(stderr, "larder: fatal: state confined to dispatch queue '%s' used outside it\n",
               label.c_str());
  std::fflush(stderr);
  std::abort();
}

}  // namespace larder
