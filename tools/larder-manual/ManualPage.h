#pragma once

#include <CLI/CLI.hpp>
#include <ostream>
#include <string>

namespace larder {

// A manual page in roff (man(7)) written from a command line's own
// definitions: its synopsis, every option and command with its help, and
// the sections a program adds in prose.
class ManualPage {
 public:
  struct Section {
    std::string title;
    std::string text;  // paragraphs separated by blank lines
    // Each paragraph's first line is a term, the rest its description.
    bool terms = false;
  };

  // `synopsis` follows the program's name.
  static void write(std::ostream& out, const CLI::App& app, const std::string& section,
                    const std::string& version, const std::string& synopsis,
                    const std::vector<Section>& extra);
  // Escapes what roff would read as requests or escapes.
  static std::string escape(const std::string& text);
};

}  // namespace larder
