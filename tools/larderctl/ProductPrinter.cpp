#include "tools/larderctl/ProductPrinter.h"

#include <algorithm>
#include <iostream>
#include <vector>

#include "client/DBusValueCodec.h"
#include "platform/plist/JsonConversion.h"
#include "tools/larderctl/ValueText.h"

namespace larder {

namespace {

const char* stateName(std::int64_t state) {
  switch (state) {
    case 0:
      return "Added";
    case 2:
      return "Changed";
    default:
      return "Removed";
  }
}

std::string field(const PlistValue& product, std::string_view key) {
  const PlistValue& value = product[key];
  if (const std::string* text = value.string()) return *text;
  if (value.isInteger()) return std::to_string(value.uint64Value());
  return "-";
}

using Row = std::vector<std::string>;

void printTable(const std::vector<Row>& rows) {
  std::vector<std::size_t> widths;
  for (const Row& row : rows) {
    widths.resize(std::max(widths.size(), row.size()));
    for (std::size_t i = 0; i < row.size(); ++i) widths[i] = std::max(widths[i], row[i].size());
  }
  for (const Row& row : rows) {
    std::string line;
    for (std::size_t i = 0; i < row.size(); ++i) {
      line += row[i];
      if (i + 1 < row.size()) line += std::string(widths[i] - row[i].size() + 2, ' ');
    }
    std::cout << line << '\n';
  }
  std::cout.flush();
}

Row productRow(const PlistValue& product) {
  return {field(product, "bundleIdentifier"), field(product, "bundleVersion"),
          field(product, "itemIdentifier"), field(product, "bundlePath")};
}

}  // namespace

void ProductPrinter::printProducts(const PlistValue& products) const {
  if (json_) {
    std::cout << JsonConversion::toJson(products).dump(2) << std::endl;
    return;
  }
  const PlistArray* list = products.array();
  if (!list || list->empty()) {
    std::cout << "no store software is installed" << std::endl;
    return;
  }
  std::vector<Row> rows{{"BUNDLE ID", "VERSION", "ITEM ID", "PATH"}};
  {
    for (const PlistValue& product : *list) rows.push_back(productRow(product));
    std::sort(rows.begin() + 1, rows.end());
  }
  printTable(rows);
}

void ProductPrinter::printProduct(const PlistValue& product) const {
  if (json_) {
    std::cout << JsonConversion::toJson(product).dump(2) << std::endl;
    return;
  }
  std::vector<Row> rows;
  if (const PlistDictionary* fields = product.dictionary()) {
    for (const auto& [key, value] : *fields) rows.push_back({key, ValueText::of(key, value)});
  }
  printTable(rows);
}

void ProductPrinter::printChange(const PlistValue& product, std::int64_t state) const {
  if (json_) {
    nlohmann::json line{{"state", state},
                        {"stateName", stateName(state)},
                        {"product", JsonConversion::toJson(product)}};
    std::cout << line.dump() << std::endl;
    return;
  }
  std::cout << stateName(state) << '\t' << field(product, "bundleIdentifier") << '\t'
            << field(product, "bundleVersion") << '\t' << field(product, "bundlePath") << std::endl;
}

void ProductPrinter::printReply(const PlistArray& reply) const {
  if (json_) {
    nlohmann::json document = nlohmann::json::array();
    for (const PlistValue& value : reply) document.push_back(JsonConversion::toJson(value));
    std::cout << document.dump(2) << std::endl;
    return;
  }
  for (const PlistValue& value : reply) {
    std::cout << (value.string() ? *value.string() : JsonConversion::toJson(value).dump(2)) << '\n';
  }
  std::cout.flush();
}

}  // namespace larder
