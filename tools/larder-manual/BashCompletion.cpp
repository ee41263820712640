#include "tools/larder-manual/BashCompletion.h"

#include <string>

namespace larder {
namespace {

std::string optionWords(const CLI::App& app) {
  std::string words;
  for (const CLI::Option* option : app.get_options()) {
    if (!option->nonpositional()) continue;
    for (const std::string& name : option->get_lnames()) words += " --" + name;
    for (const std::string& name : option->get_snames()) words += " -" + name;
  }
  // A command's own commands ("prefs get") complete as its words too.
  for (const CLI::App* action : app.get_subcommands({})) words += " " + action->get_name();
  return words.empty() ? words : words.substr(1);
}

std::string functionName(const CLI::App& app) {
  std::string name = "_" + app.get_name();
  for (char& c : name) {
    if (c == '-') c = '_';
  }
  return name;
}

}  // namespace

void BashCompletion::write(std::ostream& out, const CLI::App& app) {
  std::string commands;
  for (const CLI::App* command : app.get_subcommands({})) commands += command->get_name() + " ";
  const std::string function = functionName(app);
  out << "# bash completion for " << app.get_name() << "; written from its command line.\n"
      << function << "() {\n"
      << "  local current=${COMP_WORDS[COMP_CWORD]} command= word\n"
      << "  for word in \"${COMP_WORDS[@]:1:COMP_CWORD-1}\"; do\n"
      << "    case \" " << commands << "\" in *\" $word \"*) command=$word; break;; esac\n"
      << "  done\n"
      << "  case $command in\n";
  for (const CLI::App* command : app.get_subcommands({})) {
    out << "    " << command->get_name() << ") COMPREPLY=($(compgen -W \"" << optionWords(*command)
        << "\" -- \"$current\"));;\n";
  }
  out << "    *) COMPREPLY=($(compgen -W \"" << commands << optionWords(app)
      << "\" -- \"$current\"));;\n"
      << "  esac\n"
      << "}\n"
      << "complete -F " << function << " " << app.get_name() << "\n";
}

}  // namespace larder
