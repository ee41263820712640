#pragma once

#include <memory>
#include <string>
#include <vector>

#include "platform/error/VendError.h"

namespace larder {

// "(a, b, c)": the descriptions of a list of records or of shared records,
// for log lines.
template <typename Element>
std::string describeList(const std::vector<Element>& list) {
  std::string text = "(";
  for (const Element& element : list) {
    if (text.size() > 1) text += ", ";
    if constexpr (requires { element->description(); }) {
      text += element ? element->description() : std::string("(null)");
    } else if constexpr (requires { element.description(); }) {
      text += element.description();
    } else {
      text += element;
    }
  }
  return text + ")";
}

// An error as log lines show it; "(null)" for none.
inline std::string describeError(const OptionalError& error) {
  return error ? error->descriptionText() : std::string("(null)");
}

}  // namespace larder
