#pragma once

#include <string>

namespace larder {

class Uuid {
 public:
  // A random UUID in its upper-case text form.
  static std::string generateString();
};

}  // namespace larder
