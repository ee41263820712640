#include "store-runtime/records/TillPurchase.h"

#include <charconv>

#include "store-runtime/core/VendStringHelpers.h"
#include "store-runtime/records/RecordFieldReader.h"
#include "store-runtime/records/RecordFieldWriter.h"

namespace larder {

namespace {

// The wire keys are the field names, except that the buy parameters go
// under the store's own name for them.
constexpr std::string_view kBuyParamsKey = "buyParams";
constexpr std::string_view kItemIdentifierKey = "itemIdentifier";
constexpr std::string_view kPurchaseTypeKey = "purchaseType";
constexpr std::string_view kParentalControlsKey = "parentalControls";
constexpr std::string_view kIsUpdateKey = "isUpdate";
constexpr std::string_view kIsRedownloadKey = "isRedownload";
constexpr std::string_view kIsOVPKey = "isOVP";
constexpr std::string_view kIsAccountLessPurchaseKey = "isAccountLessPurchase";
constexpr std::string_view kAccountLessOptionsKey = "accountLessOptions";
constexpr std::string_view kCheckPreflightKey = "checkPreflightAterPurchase";
constexpr std::string_view kOrvaneIDKey = "orvaneID";
constexpr std::string_view kAccountIdentifierKey = "accountIdentifier";

constexpr std::string_view kItemIdParameter = "itemId";
constexpr std::string_view kSalableWareIdParameter = "salableWareId";

// The value of the first parameter named `name` in query text; no
// percent-decoding, since the values we look for are plain numbers.
std::optional<std::string_view> queryValue(std::string_view query, std::string_view name) {
  if (query.starts_with('?')) query.remove_prefix(1);
  while (!query.empty()) {
    const std::size_t end = query.find('&');
    const std::string_view pair = query.substr(0, end);
    const std::size_t equals = pair.find('=');
    if (equals != std::string_view::npos && pair.substr(0, equals) == name) {
      return pair.substr(equals + 1);
    }
    if (end == std::string_view::npos) break;
    query.remove_prefix(end + 1);
  }
  return std::nullopt;
}

std::optional<std::uint64_t> numericParameter(std::string_view query, std::string_view name) {
  const std::optional<std::string_view> text = queryValue(query, name);
  return text ? unsignedDecimalNumber(*text) : std::nullopt;
}

void putFields(RecordFieldWriter& writer, const TillPurchase& purchase) {
  writer.put(kBuyParamsKey, purchase.buyParameters());
  writer.put(kItemIdentifierKey, purchase.itemIdentifier());
  writer.put(kPurchaseTypeKey, purchase.purchaseType());
  writer.put(kParentalControlsKey, purchase.parentalControls());
  writer.put(kIsUpdateKey, purchase.isUpdate());
  writer.put(kIsRedownloadKey, purchase.isRedownload());
  writer.put(kIsOVPKey, purchase.isOVP());
  writer.put(kIsAccountLessPurchaseKey, purchase.isAccountLessPurchase());
  writer.put(kAccountLessOptionsKey, purchase.accountLessOptions());
  writer.put(kCheckPreflightKey, purchase.checkPreflightAterPurchase());
  writer.put(kOrvaneIDKey, purchase.orvaneID());
  writer.put(kAccountIdentifierKey, purchase.accountIdentifier());
}

TillPurchase readFields(RecordFieldReader& reader) {
  TillPurchase purchase;
  purchase.setBuyParameters(reader.string(kBuyParamsKey).value_or(""));
  purchase.setItemIdentifier(reader.unsignedInteger(kItemIdentifierKey).value_or(0));
  purchase.setPurchaseType(
      reader.integer(kPurchaseTypeKey).value_or(TillPurchase::kPurchaseTypeUnspecified));
  purchase.setParentalControls(reader.value(kParentalControlsKey));
  purchase.setIsUpdate(reader.boolean(kIsUpdateKey).value_or(false));
  purchase.setIsRedownload(reader.boolean(kIsRedownloadKey).value_or(false));
  purchase.setIsOVP(reader.boolean(kIsOVPKey).value_or(false));
  purchase.setIsAccountLessPurchase(reader.boolean(kIsAccountLessPurchaseKey).value_or(false));
  purchase.setAccountLessOptions(reader.dictionary(kAccountLessOptionsKey));
  // An explicit flag wins over the one the options imply.
  if (std::optional<bool> check = reader.boolean(kCheckPreflightKey)) {
    purchase.setCheckPreflightAterPurchase(*check);
  }
  purchase.setOrvaneID(reader.string(kOrvaneIDKey));
  purchase.setAccountIdentifier(reader.unsignedInteger(kAccountIdentifierKey).value_or(0));
  return purchase;
}

}  // namespace

TillPurchase TillPurchase::purchaseWithBuyParameters(std::string buyParameters) {
  TillPurchase purchase;
  purchase.setItemIdentifier(itemIdentifierFromBuyParameters(buyParameters).value_or(0));
  purchase.setBuyParameters(std::move(buyParameters));
  return purchase;
}

std::optional<std::uint64_t> TillPurchase::itemIdentifierFromBuyParameters(
    std::string_view parameters) {
  if (std::optional<std::uint64_t> item = numericParameter(parameters, kItemIdParameter)) {
    return item;
  }
  return numericParameter(parameters, kSalableWareIdParameter);
}

void TillPurchase::setAccountLessOptions(std::optional<PlistDictionary> options) {
  checkPreflightAterPurchase_ =
      accountLessOption(options, TillPurchaseAccountLessOptionPerformPreflightCheck);
  accountLessOptions_ = std::move(options);
}

bool TillPurchase::accountLessOption(const std::optional<PlistDictionary>& options,
                                     std::string_view key) {
  if (!options) return false;
  const auto found = options->find(key);
  if (found == options->end()) return false;
  const PlistValue& value = found->second;
  return (value.isBoolean() || value.isInteger()) && value.boolValue();
}

PlistDictionary TillPurchase::encodeWithCoder() const {
  return RecordFieldWriter::archive(kClassName, *this, putFields);
}

std::optional<TillPurchase> TillPurchase::initWithCoder(const PlistValue& encoded) {
  return RecordFieldReader::unarchive(encoded, kClassName, readFields);
}

PlistDictionary TillPurchase::toDictionary() const {
  return RecordFieldWriter::dictionary(*this, putFields);
}

std::optional<TillPurchase> TillPurchase::fromDictionary(const PlistDictionary& dictionary) {
  return RecordFieldReader::read(dictionary, readFields);
}

std::string TillPurchase::description() const {
  return "<TillPurchase: itemIdentifier=" + std::to_string(itemIdentifier_) +
         " purchaseType=" + std::to_string(purchaseType_) + " buyParameters=" + buyParameters_ +
         " isUpdate=" + (isUpdate_ ? "1" : "0") + " isRedownload=" + (isRedownload_ ? "1" : "0") +
         " isOVP=" + (isOVP_ ? "1" : "0") +
         " isAccountLessPurchase=" + (isAccountLessPurchase_ ? "1" : "0") + ">";
}

}  // namespace larder
