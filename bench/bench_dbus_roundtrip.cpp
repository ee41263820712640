// ProductForBundleIdentifier over D-Bus against larderd with 10,000
// products, and the same call against a bare sd-bus method that answers
// with the same record, in the same run on the same private bus. Also
// reports larderd's resident memory once loaded and idle.
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <atomic>
#include <fstream>
#include <random>
#include <thread>

#include "BenchProcesses.h"
#include "ProductStoreFixture.h"
#include "client/DBusValueCodec.h"
#include "client/ServiceClient.h"

extern char** environ;

namespace {

using larder::PlistArray;
using larder::ServiceClient;
using larder::bench::ProductStoreFixture;
using larder::bench::spawn;

constexpr std::size_t kProducts = 10'000;

// A bare sd-bus server: one method, same argument, same reply record.
class BareServer {
 public:
  explicit BareServer(const std::string& address) {
    sd_bus_new(&bus_);
    sd_bus_set_address(bus_, address.c_str());
    sd_bus_set_bus_client(bus_, 1);
    sd_bus_start(bus_);
    sd_bus_add_object_vtable(bus_, nullptr, "/bare", "com.example.Bare", kVtable, nullptr);
    sd_bus_request_name(bus_, "com.example.bare", 0);
    thread_ = std::thread([this] {
      while (!stop_) {
        int r = sd_bus_process(bus_, nullptr);
        if (r == 0) sd_bus_wait(bus_, 100'000);
      }
    });
  }
  ~BareServer() {
    stop_ = true;
    thread_.join();
    sd_bus_flush_close_unref(bus_);
  }

 private:
  static int productForBundleIdentifier(sd_bus_message* call, void*, sd_bus_error*) {
    const char* identifier = nullptr;
    sd_bus_message_read(call, "s", &identifier);
    sd_bus_message* reply = nullptr;
    sd_bus_message_new_method_return(call, &reply);
    std::string path = std::string("/tmp/root/Applications/App.app");
    sd_bus_message_append(reply, "a{sv}", 11, "accountOpaqueID", "s", "opaque-account-1",
                          "bundleIdentifier", "s", identifier, "bundlePath", "s", path.c_str(),
                          "bundleVersion", "s", "1.42.3", "installed", "b", 1, "isLegacyApp", "b",
                          0, "itemIdentifier", "t", uint64_t{400000042}, "metadataChangeIsExpected",
                          "b", 0, "purchaseDate", "d", 1700000042.0, "source", "x", int64_t{4},
                          "versionIdentifier", "x", int64_t{800042});
    int r = sd_bus_send(nullptr, reply, nullptr);
    sd_bus_message_unref(reply);
    return r;
  }
  static constexpr sd_bus_vtable kVtable[] = {
      SD_BUS_VTABLE_START(0),
      SD_BUS_METHOD("ProductForBundleIdentifier", "s", "a{sv}", productForBundleIdentifier, 0),
      SD_BUS_VTABLE_END};

  sd_bus* bus_ = nullptr;
  std::atomic<bool> stop_{false};
  std::thread thread_;
};

struct Environment {
  Environment() : fixture(kProducts) {
    const std::string& address = bus.address();
    servicePid =
        spawn({LARDERD_PATH},
              {"DBUS_SESSION_BUS_ADDRESS=" + address, "HOME=" + fixture.directory() + "/home",
               "LARDER_ROOT=" + fixture.directory() + "/root",
               "XDG_CACHE_HOME=" + fixture.cacheHome(), "LARDER_LOG_LEVEL=0",
               // The persisted store is all there is to load.
               "__OSINSTALL_ENVIRONMENT=bench"},
              -1);
    bare = std::make_unique<BareServer>(address);
    service = std::make_unique<ServiceClient>(sdbus::createSessionBusConnectionWithAddress(address),
                                              "com.orvane.larderd", 10'000'000);
    for (int attempt = 0; attempt < 200; ++attempt) {
      try {
        service->call("ProductForBundleIdentifier", {std::string("com.example.app1")});
        break;
      } catch (const std::exception&) {
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
      }
    }
    bareConnection = sdbus::createSessionBusConnectionWithAddress(address);
    bareProxy = sdbus::createProxy(*bareConnection, "com.example.bare", "/bare");
  }
  ~Environment() {
    service.reset();
    bare.reset();
    kill(servicePid, SIGKILL);
    waitpid(servicePid, nullptr, 0);
  }

  ProductStoreFixture fixture;
  larder::bench::PrivateSessionBus bus;
  pid_t servicePid = -1;
  std::unique_ptr<BareServer> bare;
  std::unique_ptr<ServiceClient> service;
  std::unique_ptr<sdbus::IConnection> bareConnection;
  std::unique_ptr<sdbus::IProxy> bareProxy;
};

Environment& environment() {
  static Environment instance;
  return instance;
}

void BM_LarderdProductForBundleIdentifier(benchmark::State& state) {
  Environment& e = environment();
  std::minstd_rand random(1);
  for (auto _ : state) {
    PlistArray reply =
        e.service->call("ProductForBundleIdentifier",
                        {ProductStoreFixture::bundleIdentifier(random() % kProducts)});
    if (!reply.at(0).dictionary() || reply.at(0).dictionary()->empty()) {
      state.SkipWithError("no product in the reply");
      break;
    }
  }
}
BENCHMARK(BM_LarderdProductForBundleIdentifier)->UseRealTime();

void BM_BareSdBusMethod(benchmark::State& state) {
  Environment& e = environment();
  std::minstd_rand random(1);
  for (auto _ : state) {
    sdbus::MethodCall call =
        e.bareProxy->createMethodCall("com.example.Bare", "ProductForBundleIdentifier");
    call << ProductStoreFixture::bundleIdentifier(random() % kProducts);
    sdbus::MethodReply reply = e.bareProxy->callMethod(call);
    benchmark::DoNotOptimize(larder::DBusValueCodec::read(reply, "a{sv}"));
  }
}
BENCHMARK(BM_BareSdBusMethod)->UseRealTime();

// Resident memory of the idle service with the products loaded.
void BM_LarderdIdleResidentMemory(benchmark::State& state) {
  Environment& e = environment();
  std::this_thread::sleep_for(std::chrono::milliseconds(300));
  long kilobytes = 0;
  for (auto _ : state) {
    std::ifstream status("/proc/" + std::to_string(e.servicePid) + "/status");
    std::string line;
    while (std::getline(status, line)) {
      if (line.rfind("VmRSS:", 0) == 0) kilobytes = std::stol(line.substr(6));
    }
  }
  state.counters["rss_MB"] = static_cast<double>(kilobytes) / 1024.0;
}
BENCHMARK(BM_LarderdIdleResidentMemory)->Iterations(1);

}  // namespace

BENCHMARK_MAIN();
