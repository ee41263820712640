#include "tools/larder-manual/ManualPage.h"

#include <cctype>
#include <sstream>

namespace larder {
namespace {

// "--timeout TIMEOUT" for an option with a value, the name for a flag or
// an argument.
std::string optionName(const CLI::Option& option) {
  std::string names = option.get_name(false, true);
  if (option.nonpositional() && option.get_items_expected_min() > 0) {
    std::string value = option.get_name();
    value.erase(0, value.find_first_not_of('-'));
    for (char& c : value) c = c == '-' ? '_' : static_cast<char>(std::toupper(c));
    names += " " + value;
  }
  return names;
}

void writeOptions(std::ostream& out, const CLI::App& app) {
  for (const CLI::Option* option : app.get_options()) {
    // Every command has --help; the page says so once, for the program.
    if (option->get_name().empty() || (app.get_parent() && option == app.get_help_ptr())) continue;
    out << ".TP\n.B " << ManualPage::escape(optionName(*option)) << "\n"
        << ManualPage::escape(option->get_description()) << "\n";
  }
}

void writeSection(std::ostream& out, const ManualPage::Section& section) {
  std::istringstream lines(section.text);
  std::string line;
  bool startsParagraph = true;
  while (std::getline(lines, line)) {
    if (line.empty()) {
      startsParagraph = true;
      continue;
    }
    if (startsParagraph) out << (section.terms ? ".TP\n.B " : ".PP\n");
    out << ManualPage::escape(line) << "\n";
    startsParagraph = false;
  }
}

}  // namespace

std::string ManualPage::escape(const std::string& text) {
  std::string escaped;
  for (const char c : text) {
    if (c == '\\') {
      escaped += "\\e";
    } else if (c == '-') {
      escaped += "\\-";
    } else {
      escaped += c;
    }
  }
  // A line that starts with a dot or a quote would be a request.
  if (!escaped.empty() && (escaped.front() == '.' || escaped.front() == '\'')) {
    escaped.insert(0, "\\&");
  }
  return escaped;
}

namespace {

// A command, then its own commands under their full names ("prefs get").
void writeCommand(std::ostream& out, const CLI::App& command, const std::string& parents) {
  const std::string name = parents + command.get_name();
  out << ".SS " << ManualPage::escape(name) << "\n"
      << ManualPage::escape(command.get_description()) << "\n";
  writeOptions(out, command);
  for (const CLI::App* action : command.get_subcommands({})) {
    writeCommand(out, *action, name + " ");
  }
}

}  // namespace

void ManualPage::write(std::ostream& out, const CLI::App& app, const std::string& section,
                       const std::string& version, const std::string& synopsis,
                       const std::vector<Section>& extra) {
  const std::string name = app.get_name();
  std::string upper = name;
  for (char& c : upper) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
  out << ".TH " << upper << " " << section << " \"\" \"larder " << version << "\"\n"
      << ".SH NAME\n"
      << escape(name) << " \\- " << escape(app.get_description()) << "\n"
      << ".SH SYNOPSIS\n.B " << escape(name) << "\n"
      << escape(synopsis) << "\n";
  if (!app.get_options().empty()) {
    out << ".SH OPTIONS\n";
    writeOptions(out, app);
  }
  if (!app.get_subcommands({}).empty()) {
    out << ".SH COMMANDS\n";
    for (const CLI::App* command : app.get_subcommands({})) writeCommand(out, *command, "");
  }
  for (const Section& part : extra) {
    out << ".SH " << escape(part.title) << "\n";
    writeSection(out, part);
  }
}

}  // namespace larder
