// larder-store: the reference store server, and the tool that packs a
// bundle into the package the store serves.
#include <pthread.h>
#include <signal.h>
#include <sys/prctl.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <iostream>
#include <string>
#include <thread>
#include <vector>

#include "larder-store/PackageBuilder.h"
#include "larder-store/StoreCatalogue.h"
#include "larder-store/StoreFaults.h"
#include "larder-store/StoreServer.h"
#include "platform/system/StopSignals.h"

namespace {

using namespace larder;

struct ServeOptions {
  std::string catalogue;
  std::string host = "127.0.0.1";
  int port = 0;
  std::vector<std::string> faults;
  bool exitWithParent = false;
  pid_t starter = ::getppid();
};

struct PackOptions {
  std::string bundle;
  std::string output;
};

std::string urlHost(const std::string& host) {
  return host.find(':') == std::string::npos ? host : "[" + host + "]";
}

int pack(const PackOptions& options) {
  if (auto packed = PackageBuilder::pack(options.bundle, options.output); !packed) {
    std::cerr << "larder-store pack: " << packed.error().description << "\n";
    return 1;
  }
  return 0;
}

int serve(const ServeOptions& options) {
  const auto faults = StoreFaults::parse(options.faults);
  if (!faults) {
    std::cerr << "larder-store: " << faults.error().description << "\n";
    return 2;
  }
  // The stop signals are taken by one thread of their own, so that every
  // other thread (httplib's workers included) runs with them blocked.
  const sigset_t signals = StopSignals::set();
  StopSignals::block();
  // A test that crashes must not leave its store running: the end of the
  // thread that started us stops us like SIGTERM does.
  if (options.exitWithParent) {
    ::prctl(PR_SET_PDEATHSIG, SIGTERM);
    if (::getppid() != options.starter) return 1;  // it ended before we could watch it
  }
  ::signal(SIGPIPE, SIG_IGN);  // a client that goes away is an error of that write, not our end

  auto catalogue = StoreCatalogue::load(options.catalogue);
  if (!catalogue) {
    std::cerr << "larder-store: " << catalogue.error().description << "\n";
    return 1;
  }
  StoreServer server(std::move(*catalogue), *faults);
  const auto port = server.bind(options.host, options.port);
  if (!port) {
    std::cerr << "larder-store: cannot listen on " << options.host << ":" << options.port << "\n";
    return 1;
  }
  std::atomic<bool> served{false};
  std::thread signalWaiter([&server, &served, signals] {
    int received = 0;
    sigwait(&signals, &received);
    // A stop before the server serves would go unnoticed.
    while (!served && !server.isServing()) {
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    server.stop();
  });
  std::cout << "larder-store listening on http://" << urlHost(options.host) << ":" << *port
            << std::endl;
  const bool ok = server.serve();
  served = true;
  ::kill(::getpid(), SIGTERM);  // ends the waiter when serving ended without a signal
  signalWaiter.join();
  return ok ? 0 : 1;
}

}  // namespace

int main(int argc, char** argv) {
  CLI::App app{"larder-store: the reference store server"};
  ServeOptions serveOptions;
  app.add_option("--catalogue", serveOptions.catalogue, "catalogue folder to serve");
  app.add_option("--host", serveOptions.host, "address to listen on")->capture_default_str();
  app.add_option("--port", serveOptions.port, "port to listen on; 0 picks a free one")
      ->capture_default_str()
      ->check(CLI::Range(0, 65535));
  app.add_option("--fault", serveOptions.faults,
                 "ROUTE=KIND: answer ROUTE (bag, authenticate, buy-product, item-lookup, assets, "
                 "preflight, daap-login, daap-update, daap-databases, daap-items, ...) with a "
                 "fault: 500, stall, not-plist, wrong-shape, truncate, corrupt");

  app.add_flag("--exit-with-parent", serveOptions.exitWithParent,
               "stop when the thread that started the store ends (for test harnesses)");

  PackOptions packOptions;
  CLI::App* packCommand = app.add_subcommand("pack", "pack a bundle folder into a package");
  packCommand->add_option("bundle", packOptions.bundle, "bundle folder")->required();
  packCommand->add_option("output", packOptions.output, "package file to write")->required();
  app.require_subcommand(0, 1);

  CLI11_PARSE(app, argc, argv);
  if (*packCommand) return pack(packOptions);
  if (serveOptions.catalogue.empty()) {
    std::cerr << "larder-store: --catalogue is required\n" << app.help();
    return 2;
  }
  return serve(serveOptions);
}
