#include "store-runtime/records/LedgerBook.h"

#include "platform/plist/KeyedArchive.h"
#include "store-runtime/records/RecordFieldReader.h"
#include "store-runtime/records/RecordFieldWriter.h"

namespace larder {

namespace {

void putFields(PlistDictionary& target, const LedgerBookFields& fields) {
  fields.writeTo(target);
  RecordFieldWriter writer(target);
  writer.put("isLocal", fields.isLocal);
  writer.put("path", fields.path);
  writer.put("bookInfo", fields.bookInfo);
  writer.put("sonorelMetaData", fields.sonorelMetaData);
}

std::shared_ptr<LedgerBook> readBook(RecordFieldReader& reader) {
  LedgerBookFields fields;
  static_cast<LedgerCloudItemFields&>(fields) = LedgerCloudItemFields::readFrom(reader);
  fields.isLocal = reader.boolean("isLocal").value_or(false);
  fields.path = reader.string("path");
  fields.bookInfo = reader.dictionary("bookInfo");
  fields.sonorelMetaData = reader.dictionary("sonorelMetaData");
  if (!reader.ok()) return nullptr;
  return std::make_shared<LedgerBook>(std::move(fields));
}

}  // namespace

std::shared_ptr<LedgerBook> LedgerBook::copy() const {
  return std::make_shared<LedgerBook>(*this);
}

PlistDictionary LedgerBook::encodeWithCoder() const {
  PlistDictionary encoded = KeyedArchive::record(kClassName);
  putFields(encoded, fields_);
  return encoded;
}

std::shared_ptr<LedgerBook> LedgerBook::initWithCoder(const PlistValue& encoded) {
  if (KeyedArchive::classNameOf(encoded) != kClassName) return nullptr;
  RecordFieldReader reader(encoded);
  return readBook(reader);
}

PlistDictionary LedgerBook::toDictionary() const {
  PlistDictionary dictionary;
  putFields(dictionary, fields_);
  return dictionary;
}

std::shared_ptr<LedgerBook> LedgerBook::fromDictionary(const PlistDictionary& dictionary) {
  RecordFieldReader reader(dictionary);
  return readBook(reader);
}

std::string LedgerBook::description() const {
  return "<LedgerBook: isLocal=" + std::string(fields_.isLocal ? "1" : "0") +
         " path=" + fields_.path.value_or("(null)") + " " + fields_.describeIdentity() + ">";
}

}  // namespace larder
