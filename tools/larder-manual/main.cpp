// larder-manual: writes the manual pages of larderctl and larderd and the
// bash completion of larderctl into a folder, from the programs' own
// definitions. Run by the build; its output is installed.
#include <fstream>
#include <iostream>
#include <sstream>
#include <string>

#include "AssetService/ServiceEntry.h"
#include "tools/larder-manual/BashCompletion.h"
#include "tools/larder-manual/ManualPage.h"
#include "tools/larderctl/CommandLine.h"

namespace {

using namespace larder;

const char* const kEnvironment =
    "LARDER_BUS\nsystem: the service and its clients are on the system bus; the session bus "
    "otherwise.\n\n"
    "LARDER_ROOT\nthe platform root below which larderd reads every platform path (/ when "
    "unset).\n\n"
    "LARDER_STORE_URL\nthe store's URL bag (larderd).\n\n"
    "LARDER_STORE_TIMEOUT\nseconds without progress after which a store request fails "
    "(larderd; 60 when unset).\n\n"
    "LARDER_LOG_LEVEL\nhow much larderd logs: 1 errors and decisions, 2 events, 3 detail.";

std::string larderdPage() {
  return std::string(
             "larderd keeps the index of the store software installed for this user, asks "
             "the store which updates exist, and buys, downloads and installs them. It "
             "serves on the session bus as ") +
         ServiceEntry::kServiceName + ", or as " + ServiceEntry::kDaemonServiceName +
         " when started with the one argument \"" + ServiceEntry::kDaemonArgument +
         "\". Any other argument is ignored, said so on standard error, and the service starts "
         "all the same.\n\nIt is started by systemd --user (larderd.service) or by D-Bus "
         "activation; larderctl(1) talks to it.";
}

bool writeFile(const std::string& path, const std::string& text) {
  std::ofstream out(path, std::ios::trunc);
  out << text;
  out.close();
  if (!out) std::cerr << "larder-manual: cannot write " << path << std::endl;
  return static_cast<bool>(out);
}

}  // namespace

int main(int argc, char** argv) {
  if (argc != 2) {
    std::cerr << "usage: larder-manual FOLDER" << std::endl;
    return 2;
  }
  const std::string folder = argv[1];
  CommandLine line;
  std::ostringstream larderctl;
  ManualPage::write(larderctl, line.app(), "1", LARDER_VERSION, "[OPTIONS] COMMAND [ARGS]",
                    {{"EXIT STATUS",
                      "0\nsuccess\n\n1\nthe operation failed, or the service could not be "
                      "reached\n\n2\nthe command line was wrong; nothing was tried\n\n3\nnothing "
                      "to do: updates found none, install had nothing to install",
                      true},
                     {"ENVIRONMENT", kEnvironment, true},
                     {"SEE ALSO", "larderd(8)"}});
  CLI::App larderdApp("the per-user service of the larder store", "larderd");
  larderdApp.set_help_flag();
  std::ostringstream larderd;
  ManualPage::write(larderd, larderdApp, "8", LARDER_VERSION,
                    std::string("[") + ServiceEntry::kDaemonArgument + "]",
                    {{"DESCRIPTION", larderdPage()},
                     {"ENVIRONMENT", kEnvironment, true},
                     {"SEE ALSO", "larderctl(1)"}});
  std::ostringstream completion;
  BashCompletion::write(completion, line.app());
  const bool written = writeFile(folder + "/larderctl.1", larderctl.str()) &&
                       writeFile(folder + "/larderd.8", larderd.str()) &&
                       writeFile(folder + "/larderctl", completion.str());
  return written ? 0 : 1;
}
