#include "store-runtime/core/StoreClientRegistry.h"

#include <gtest/gtest.h>

#include <atomic>
#include <latch>
#include <set>
#include <thread>

namespace larder {
namespace {

// Counts constructions, so that a registry that made two objects for one
// identifier under a race is caught.
struct PerClientObject {
  explicit PerClientObject(const VendStoreClient& client) : client(client) { ++constructions; }
  VendStoreClient client;
  static inline std::atomic<int> constructions{0};
};

TEST(StoreClientRegistry, OneObjectPerIdentifierWhateverTheConnection) {
  StoreClientRegistry<PerClientObject> registry;
  VendStoreClient store = VendStoreClient::initWithStoreClientType(0);
  VendStoreClient sameIdentifierOtherType("com.orvane.quaymart", 1, 7, "elsewhere");
  VendStoreClient books = VendStoreClient::initWithStoreClientType(1);

  auto first = registry.objectForStoreClient(&store);
  auto second = registry.objectForStoreClient(&sameIdentifierOtherType);
  auto third = registry.objectForStoreClient(&books);
  ASSERT_TRUE(first && third);
  EXPECT_EQ(first, second);
  EXPECT_NE(first, third);
  EXPECT_EQ(first->client.clientType(), 0) << "made with the client that asked first";
  VendStoreClient anonymous("", 0, 0, "");
  EXPECT_EQ(registry.objectForStoreClient(nullptr), nullptr);
  EXPECT_EQ(registry.objectForStoreClient(&anonymous), nullptr) << "no identifier, no object";
  EXPECT_EQ(registry.size(), 2u);
}

TEST(StoreClientRegistry, ConcurrentFirstUseMakesOneObject) {
  StoreClientRegistry<PerClientObject> registry;
  VendStoreClient client = VendStoreClient::initWithStoreClientType(0);
  int before = PerClientObject::constructions.load();
  constexpr int kThreads = 8;
  std::latch start(kThreads);
  std::vector<std::shared_ptr<PerClientObject>> seen(kThreads);
  std::vector<std::thread> threads;
  for (int i = 0; i < kThreads; ++i) {
    threads.emplace_back([&, i] {
      start.arrive_and_wait();
      seen[static_cast<std::size_t>(i)] = registry.objectForStoreClient(&client);
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(PerClientObject::constructions.load() - before, 1);
  EXPECT_EQ(std::set(seen.begin(), seen.end()).size(), 1u);
}

}  // namespace
}  // namespace larder
