#include "dmap/DAAPDocumentBudget.h"

#include <algorithm>
#include <limits>
#include <vector>

namespace larder {

namespace {

thread_local DAAPDocumentBudget* currentBudget = nullptr;

std::size_t budgetFor(std::size_t size) {
  constexpr std::size_t kLargest =
      std::numeric_limits<std::size_t>::max() / DAAPDocumentBudget::kBytesPerDocumentByte;
  return std::min(size, kLargest) * DAAPDocumentBudget::kBytesPerDocumentByte;
}

// The text and data bytes of a decoded list, counted as the reader counts
// them; walked without recursion, since the list came from the network.
std::size_t decodedBytes(const PlistValue& root) {
  std::size_t total = 0;
  std::vector<const PlistValue*> pending{&root};
  while (!pending.empty()) {
    const PlistValue* value = pending.back();
    pending.pop_back();
    if (const std::string* text = value->string()) total += text->size();
    if (const PlistData* data = value->data()) total += data->size();
    if (const PlistArray* array = value->array()) {
      for (const PlistValue& element : *array) pending.push_back(&element);
    }
    if (const PlistDictionary* dictionary = value->dictionary()) {
      for (const auto& [key, element] : *dictionary) {
        total += key.size();
        pending.push_back(&element);
      }
    }
  }
  return total;
}

}  // namespace

DAAPDocumentBudget::DAAPDocumentBudget(std::size_t documentSize)
    : remaining_(budgetFor(documentSize)), previous_(currentBudget) {
  currentBudget = this;
}

DAAPDocumentBudget::~DAAPDocumentBudget() {
  currentBudget = previous_;
}

std::size_t DAAPDocumentBudget::remaining(std::size_t listSize) {
  return currentBudget ? currentBudget->remaining_ : budgetFor(listSize);
}

void DAAPDocumentBudget::charge(const PlistValue& decoded) {
  if (!currentBudget) return;
  currentBudget->remaining_ -= std::min(currentBudget->remaining_, decodedBytes(decoded));
}

}  // namespace larder
