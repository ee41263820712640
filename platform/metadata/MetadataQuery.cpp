#include "platform/metadata/MetadataQuery.h"

#include <algorithm>
#include <cstring>
#include <system_error>
#include <utility>

#include "platform/metadata/MetadataQueryPredicate.h"

namespace larder {

namespace {

using Clock = std::chrono::steady_clock;

std::vector<std::shared_ptr<const MetadataItem>> itemsOf(
    const std::vector<MetadataBundleIndex::ItemChange>& changes) {
  std::vector<std::shared_ptr<const MetadataItem>> items;
  items.reserve(changes.size());
  for (const MetadataBundleIndex::ItemChange& change : changes) items.push_back(change.item);
  return items;
}

}  // namespace

std::shared_ptr<MetadataQuery> MetadataQuery::create(std::string queryString,
                                                     std::vector<std::string> valueAttributes,
                                                     Options options) {
  // The constructor is private; make_shared cannot reach it.
  struct Constructible : MetadataQuery {
    Constructible(std::string query, std::vector<std::string> attributes, Options options)
        : MetadataQuery(std::move(query), std::move(attributes), std::move(options)) {}
  };
  return std::make_shared<Constructible>(std::move(queryString), std::move(valueAttributes),
                                         std::move(options));
}

std::shared_ptr<MetadataQuery> MetadataQuery::create(std::string queryString,
                                                     std::vector<std::string> valueAttributes) {
  return create(std::move(queryString), std::move(valueAttributes), Options{});
}

MetadataQuery::MetadataQuery(std::string queryString, std::vector<std::string> valueAttributes,
                             Options options)
    : queryString_(std::move(queryString)),
      valueAttributes_(std::move(valueAttributes)),
      options_(std::move(options)) {}

MetadataQuery::~MetadataQuery() {
  stop();
}

void MetadataQuery::setQueue(std::shared_ptr<DispatchQueue> queue) {
  MutexLock lock(mutex_);
  if (!started_) queue_ = std::move(queue);
}

void MetadataQuery::setSearchScope(SearchScope /*scope*/) {
  // The whole computer is the only scope there is.
}

void MetadataQuery::setHandlers(Handlers handlers) {
  MutexLock lock(mutex_);
  handlers_ = std::move(handlers);
}

MetadataQuery::Handlers MetadataQuery::handlers() const {
  MutexLock lock(mutex_);
  return handlers_;
}

// MARK: lifecycle

bool MetadataQuery::start() {
  MutexLock lock(mutex_);
  if (started_ || stopped_) {
    startError_ = "the query was started before";
    return false;
  }
  Result<MetadataQueryPredicate> predicate = MetadataQueryPredicate::parse(queryString_);
  if (!predicate) {
    startError_ = "the query does not parse: " + predicate.error().description;
    return false;
  }
  auto watcher = std::make_unique<MetadataIndexWatcher>();
  if (const int failure = watcher->initializationError()) {
    startError_ = std::string("no inotify instance: ") + std::strerror(failure);
    return false;
  }
  if (!queue_) queue_ = DispatchQueue::create("MetadataQuery", DispatchQueue::Kind::Serial);
  MetadataBundleIndex::Options indexOptions{options_.settleLimit, options_.beforeReadingBundle};
  index_ = std::make_unique<MetadataBundleIndex>(std::move(*predicate), *watcher, indexOptions);
  watcher_ = std::move(watcher);
  try {
    engine_ = std::thread([this] { runEngine(); });
  } catch (const std::system_error& failure) {
    startError_ = std::string("no thread for the query: ") + failure.what();
    index_.reset();
    watcher_.reset();
    return false;
  }
  started_ = true;
  gathering_ = true;
  return true;
}

void MetadataQuery::stop() {
  {
    MutexLock lock(mutex_);
    stopped_ = true;
    if (!started_) return;
  }
  watcher_->wake();
  MutexLock joinLock(engineMutex_);
  if (engine_.joinable() && engine_.get_id() != std::this_thread::get_id()) engine_.join();
}

bool MetadataQuery::isStarted() const {
  MutexLock lock(mutex_);
  return started_;
}

bool MetadataQuery::isGathering() const {
  MutexLock lock(mutex_);
  return gathering_;
}

bool MetadataQuery::isStopped() const {
  return stopped_;
}

std::string MetadataQuery::startError() const {
  MutexLock lock(mutex_);
  return startError_;
}

// MARK: the query's thread

void MetadataQuery::runEngine() {
  MetadataBundleIndex::Changes initial = index_->gather(Clock::now());
  if (stopped_) return;
  if (index_->broken()) {
    postServerPortInvalid();
    return;
  }
  postChanges(std::move(initial), /*finished=*/true);
  // What changed under the gathering (a bundle gone before it was read) is looked at again.
  followTheDisk(index_->hasPendingWork());
}

// Work is applied once the disk has been quiet for the quiet period, or once the longest delay
// has passed since the first event of a burst, whichever comes first.
void MetadataQuery::followTheDisk(bool workPending) {
  bool inBurst = workPending;
  Clock::time_point firstEvent = Clock::now();
  Clock::time_point lastEvent = firstEvent;
  auto deadline = [&] {
    return std::min(lastEvent + options_.quietPeriod, firstEvent + options_.longestDelay);
  };
  while (!stopped_) {
    std::optional<std::chrono::milliseconds> timeout;
    if (inBurst) {
      timeout = std::chrono::ceil<std::chrono::milliseconds>(
          std::max(deadline() - Clock::now(), Clock::duration::zero()));
    }
    MetadataIndexWatcher::Batch batch = watcher_->waitForEvents(timeout);
    if (stopped_) return;
    if (batch.overflowed || batch.failed) {
      postServerPortInvalid();
      return;
    }
    const Clock::time_point now = Clock::now();
    bool pending = false;
    for (const MetadataIndexWatcher::Event& event : batch.events) {
      pending = index_->noteEvent(event) || pending;
    }
    if (pending) {
      if (!inBurst) firstEvent = now;
      lastEvent = now;
      inBurst = true;
    }
    if (!inBurst || now < deadline()) continue;
    MetadataBundleIndex::Changes changes = index_->applyPendingWork(now);
    if (index_->broken()) {
      postServerPortInvalid();
      return;
    }
    if (!changes.empty()) postChanges(std::move(changes), /*finished=*/false);
    // Bundles still arriving, or folders that changed under the reading, get another look.
    inBurst = index_->hasPendingWork();
    firstEvent = now;
    lastEvent = now;
  }
}

void MetadataQuery::post(std::function<void(MetadataQuery&)> delivery) {
  std::shared_ptr<DispatchQueue> queue;
  {
    MutexLock lock(mutex_);
    queue = queue_;
  }
  // A barrier keeps events in order on a concurrent queue too.
  queue->barrierAsync([weak = weak_from_this(), delivery = std::move(delivery)] {
    std::shared_ptr<MetadataQuery> self = weak.lock();
    if (self && !self->stopped_) delivery(*self);
  });
}

void MetadataQuery::postChanges(MetadataBundleIndex::Changes changes, bool finished) {
  auto shared = std::make_shared<const MetadataBundleIndex::Changes>(std::move(changes));
  post([shared, finished](MetadataQuery& query) { query.deliverChanges(*shared, finished); });
}

void MetadataQuery::postServerPortInvalid() {
  post([](MetadataQuery& query) { query.deliverServerPortInvalid(); });
}

// MARK: the owner's queue

void MetadataQuery::deliverChanges(const MetadataBundleIndex::Changes& changes, bool finished) {
  publish(changes);
  const Handlers handlers = this->handlers();
  if (finished) {
    {
      MutexLock lock(mutex_);
      gathering_ = false;
    }
    if (handlers.finished) handlers.finished(*this);
    return;
  }
  if (!handlers.updated) return;
  MetadataQueryUpdate update{itemsOf(changes.added), itemsOf(changes.changed), {}};
  update.removed.assign(changes.removed.begin(), changes.removed.end());
  handlers.updated(*this, update);
}

void MetadataQuery::deliverServerPortInvalid() {
  {
    MutexLock lock(mutex_);
    gathering_ = false;
  }
  const Handlers handlers = this->handlers();
  if (handlers.serverPortInvalid) handlers.serverPortInvalid(*this);
}

void MetadataQuery::publish(const MetadataBundleIndex::Changes& changes) {
  MutexLock lock(mutex_);
  for (const std::shared_ptr<MetadataItem>& item : changes.removed) {
    auto found = indexOfItem_.find(item.get());
    if (found == indexOfItem_.end()) continue;
    const std::size_t index = found->second;
    indexOfItem_.erase(found);
    if (index + 1 != results_.size()) {
      results_[index] = std::move(results_.back());
      indexOfItem_[results_[index].get()] = index;
    }
    results_.pop_back();
  }
  for (const MetadataBundleIndex::ItemChange& change : changes.added) {
    change.item->setAttributes(MetadataItem::Access{}, change.attributes);
    if (indexOfItem_.emplace(change.item.get(), results_.size()).second) {
      results_.push_back(change.item);
    }
  }
  for (const MetadataBundleIndex::ItemChange& change : changes.changed) {
    change.item->setAttributes(MetadataItem::Access{}, change.attributes);
  }
}

// MARK: results

std::size_t MetadataQuery::resultCount() const {
  MutexLock lock(mutex_);
  return results_.size();
}

std::shared_ptr<const MetadataItem> MetadataQuery::resultAtIndex(std::size_t index) const {
  MutexLock lock(mutex_);
  return index < results_.size() ? results_[index] : nullptr;
}

std::optional<std::size_t> MetadataQuery::indexOfResult(const MetadataItem* item) const {
  MutexLock lock(mutex_);
  auto found = indexOfItem_.find(item);
  if (found == indexOfItem_.end()) return std::nullopt;
  return found->second;
}

PlistValue MetadataQuery::valueOfAttribute(std::string_view name, std::size_t index) const {
  std::shared_ptr<const MetadataItem> item = resultAtIndex(index);
  return item ? item->valueForAttribute(name) : PlistValue();
}

PlistValue MetadataQuery::attributeOfItem(const MetadataItem& item, std::string_view name) {
  return item.valueForAttribute(name);
}

void MetadataQuery::simulateQueueOverflowForTesting() {
  MutexLock lock(mutex_);
  if (watcher_) watcher_->injectQueueOverflowForTesting();
}

}  // namespace larder
