#pragma once

#include <stdexcept>
#include <string>

#include "platform/system/FileIO.h"

namespace larder::bench {

// Writes a fixture file; a benchmark over a fixture that is not there would
// time the wrong thing, so a failed write ends it.
template <typename Contents>
void writeFixture(const std::string& path, const Contents& contents) {
  if (auto written = FileIO::writeAtomically(path, contents); !written) {
    throw std::runtime_error("cannot write fixture " + path + ": " + written.error().description);
  }
}

}  // namespace larder::bench
