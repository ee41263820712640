#pragma once

#include <string>
#include <string_view>

#include "platform/value/PlistValue.h"
#include "store-runtime/host/PreferenceStore.h"
#include "tools/larderctl/PreferencesOptions.h"

namespace larder {

// `larderctl prefs get|set|delete DOMAIN [KEY] [VALUE]`: reads and writes
// the preference files directly, as the service reads them at each use, so
// a change counts from the service's next question. Needs no service.
class PreferencesCommand {
 public:
  explicit PreferencesCommand(bool json) : json_(json) {}

  // `action` is get, set or delete. get prints one key, or the whole
  // domain without a key, and exits 1 when the key is absent; delete exits
  // 3 when there was nothing to delete.
  int run(std::string_view action, const PreferencesOptions& options) const;

  // A word typed by `type`, or without one by its look: true/false, a
  // whole number, a real number, an ISO 8601 date, JSON that starts with
  // [ or {, else text. A word that does not fit `type` is a usage error
  // (CLI::ValidationError).
  static PlistValue valueOf(const std::string& word, std::string_view type);

 private:
  int get(const PreferencesOptions& options) const;
  int set(const PreferencesOptions& options) const;
  int remove(const PreferencesOptions& options) const;
  static PreferenceScope scopeOf(const PreferencesOptions& options);
  void print(const PlistValue& value) const;

  bool json_;
};

}  // namespace larder
