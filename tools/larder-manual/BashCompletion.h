#pragma once

#include <CLI/CLI.hpp>
#include <ostream>

namespace larder {

// A bash completion script written from a command line's own definitions:
// the commands, the options of the program and of each command, and the
// fixed choices of options that have them.
class BashCompletion {
 public:
  static void write(std::ostream& out, const CLI::App& app);
};

}  // namespace larder
