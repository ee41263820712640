#pragma once

#include <cstddef>

#include "platform/value/PlistValue.h"

namespace larder {

// The bytes of text and data that the embedded property lists of one DMAP
// document may decode to, all of them together. A binary property list can
// name one long string from any number of places, each of which decodes to
// a copy, so a document of a few kilobytes could otherwise cost hundreds of
// megabytes. The budget grows with the document instead: the parse of a
// document opens one on its thread for as long as it runs, each embedded
// list may use what is left of it, and what a list used is taken off.
class DAAPDocumentBudget {
 public:
  static constexpr std::size_t kBytesPerDocumentByte = 4;

  // Becomes the budget of this thread until it ends, when the one before
  // it (if any) is back.
  explicit DAAPDocumentBudget(std::size_t documentSize);
  ~DAAPDocumentBudget();
  DAAPDocumentBudget(const DAAPDocumentBudget&) = delete;
  DAAPDocumentBudget& operator=(const DAAPDocumentBudget&) = delete;

  // What the next embedded list of `listSize` bytes may decode to. Outside
  // any document the list is a document of its own.
  static std::size_t remaining(std::size_t listSize);
  // Takes what `decoded` cost off this thread's budget.
  static void charge(const PlistValue& decoded);

 private:
  std::size_t remaining_;
  DAAPDocumentBudget* previous_;
};

}  // namespace larder
