#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/error/Result.h"
#include "platform/value/PlistValue.h"

namespace larder {

// Where a preference is looked up or stored.
enum class PreferenceScope {
  App,     // the user's value, else the machine's: what an application sees
  User,    // the current user's, on any host
  System,  // any user's, on this host
};

// Every preference read and write of the system. A domain's values live in
// one property list per scope: the user's in
// "$XDG_CONFIG_HOME/larder/<domain>.plist" (scopes app and user), the
// machine's in "<root>/etc/larder/<domain>.plist" (scope system, and the
// fallback of scope app). Nothing is cached: every read goes to the file,
// so that a value changed by another process, by `larderctl prefs` or by
// hand counts from the next question. A write is a read-modify-write under
// the file's lock that lands with an atomic rename, so two writers of one
// domain lose nothing and a reader never sees a torn file.
class PreferenceStore {
 public:
  static constexpr std::string_view kErrorDomain = "PreferenceStore";

  // The file that holds `domain` in `scope`; app and user share one.
  static std::string pathFor(std::string_view domain, PreferenceScope scope);

  // The value under `key`; null when absent or when the file is unreadable.
  static PlistValue valueForKey(std::string_view key, std::string_view domain,
                                PreferenceScope scope = PreferenceScope::App);
  // Typed reads: nullopt when absent or of another type. A number is an
  // integer or a real; a boolean is only a boolean.
  static std::optional<bool> booleanForKey(std::string_view key, std::string_view domain,
                                           PreferenceScope scope = PreferenceScope::App);
  static std::optional<double> numberForKey(std::string_view key, std::string_view domain,
                                            PreferenceScope scope = PreferenceScope::App);
  static std::optional<std::string> stringForKey(std::string_view key, std::string_view domain,
                                                 PreferenceScope scope = PreferenceScope::App);
  static std::optional<PlistDate> dateForKey(std::string_view key, std::string_view domain,
                                             PreferenceScope scope = PreferenceScope::App);

  // All values of `domain` as the scope sees them (app: the user's over the
  // machine's).
  static PlistDictionary valuesForDomain(std::string_view domain,
                                         PreferenceScope scope = PreferenceScope::App);

  // Stores `value` under `key`; a null value removes the key. Scope app
  // writes the user's file, as an application's writes do.
  static Result<void> setValue(std::string_view key, PlistValue value, std::string_view domain,
                               PreferenceScope scope = PreferenceScope::App);
  static Result<void> removeValue(std::string_view key, std::string_view domain,
                                  PreferenceScope scope = PreferenceScope::App);

  // A domain name must be usable as a file name: no separator, no dot
  // file, not empty.
  static bool isValidDomain(std::string_view domain);
};

}  // namespace larder
