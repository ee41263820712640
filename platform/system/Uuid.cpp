#include "platform/system/Uuid.h"

#include <uuid/uuid.h>

namespace larder {

std::string Uuid::generateString() {
  uuid_t bytes;
  uuid_generate_random(bytes);
  char text[37];
  uuid_unparse_upper(bytes, text);
  return text;
}

}  // namespace larder
