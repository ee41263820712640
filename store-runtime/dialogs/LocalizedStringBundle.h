#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace larder {

// Where localised texts are looked up: the string table of the store client
// framework (compiled into the runtime), the runtime's own texts (the
// bundle of VendDialog, the same table here), or a bundle on disk, whose
// table "<name>" is the property-list dictionary
// "<bundle>/resources/<name>.strings" ("Localizable" when no table is
// named). A bundle on disk is read at every lookup.
class LocalizedStringBundle {
 public:
  static LocalizedStringBundle tradelineFramework();
  static LocalizedStringBundle forVendDialog();
  static LocalizedStringBundle atPath(std::string bundlePath);

  // The text of `key`; when there is none, `value` if it is not empty,
  // else the key itself.
  [[nodiscard]] std::string localizedStringForKey(std::string_view key, std::string_view value,
                                                  std::optional<std::string_view> table) const;

  // The text of `key` as the given store client type words it, or nothing.
  // Only the framework's own table has wording per client.
  [[nodiscard]] std::optional<std::string> textForKey(std::string_view key,
                                                      std::optional<std::string_view> table,
                                                      std::optional<std::int64_t> clientType) const;

  [[nodiscard]] bool isOnDisk() const { return !bundlePath_.empty(); }

 private:
  explicit LocalizedStringBundle(std::string bundlePath) : bundlePath_(std::move(bundlePath)) {}
  std::string bundlePath_;  // empty: the compiled-in table
};

}  // namespace larder
