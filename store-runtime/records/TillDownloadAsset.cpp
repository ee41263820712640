#include "store-runtime/records/TillDownloadAsset.h"

#include <algorithm>

#include "store-runtime/records/RecordFieldReader.h"
#include "store-runtime/records/RecordFieldWriter.h"
#include "store-runtime/records/VendChunkDigestRules.h"

namespace larder {

namespace {

bool isPlainFetch(const VendURLRequest& request) {
  return request == VendURLRequest(request.url());
}

void putFields(RecordFieldWriter& writer, const TillDownloadAsset& asset) {
  writer.put("type", asset.type());
  writer.put("external", asset.external());
  writer.put("URL", asset.URLRequest().url());
  if (!isPlainFetch(asset.URLRequest()))
    writer.put("URLRequest", asset.URLRequest().toDictionary());
  writer.put("fileSize", asset.fileSize());
  writer.put("numberOfBytesToHash", asset.numberOfBytesToHash());
  writer.put("hashes", asset.hashes());
}

TillDownloadAsset readFields(RecordFieldReader& reader) {
  TillDownloadAsset asset;
  asset.setType(reader.integer("type").value_or(TillDownloadAsset::kTypeSoftwarePackage));
  asset.setExternal(reader.boolean("external").value_or(false));
  VendURLRequest request;
  if (std::optional<PlistDictionary> stored = reader.dictionary("URLRequest")) {
    request = VendURLRequest::fromDictionary(*stored);
  }
  if (std::optional<std::string> url = reader.string("URL")) request.setURL(std::move(*url));
  asset.setURLRequest(std::move(request));
  asset.setFileSize(reader.integer("fileSize").value_or(0));
  asset.setNumberOfBytesToHash(reader.integer("numberOfBytesToHash").value_or(0));
  asset.setHashes(reader.strings("hashes").value_or(std::vector<std::string>{}));
  return asset;
}

}  // namespace

std::optional<std::string> TillDownloadAsset::unusableReason() const {
  if (type_ != kTypeSoftwarePackage) {
    return "asset type " + std::to_string(type_) + " is not a software package";
  }
  if (URLRequest_.url().empty()) return "asset has no URL";
  if (fileSize_ <= 0) return "asset size " + std::to_string(fileSize_) + " is not positive";
  if (numberOfBytesToHash_ <= 0) {
    return "asset chunk size " + std::to_string(numberOfBytesToHash_) + " is not positive";
  }
  if (std::optional<std::string> problem = VendChunkDigestRules::chunkSizeProblem(
          static_cast<std::uint64_t>(numberOfBytesToHash_))) {
    return "asset " + *problem;
  }
  const auto chunks = static_cast<std::uint64_t>((fileSize_ - 1) / numberOfBytesToHash_ + 1);
  if (hashes_.size() != chunks) {
    return "asset of " + std::to_string(fileSize_) + " bytes in chunks of " +
           std::to_string(numberOfBytesToHash_) + " needs " + std::to_string(chunks) +
           " digests, the manifest has " + std::to_string(hashes_.size());
  }
  if (std::optional<std::string> problem = VendChunkDigestRules::digestListProblem(hashes_)) {
    return "asset digests: " + *problem;
  }
  return std::nullopt;
}

PlistDictionary TillDownloadAsset::encodeWithCoder() const {
  return RecordFieldWriter::archive(kClassName, *this, putFields);
}

std::optional<TillDownloadAsset> TillDownloadAsset::initWithCoder(const PlistValue& encoded) {
  return RecordFieldReader::unarchive(encoded, kClassName, readFields);
}

PlistDictionary TillDownloadAsset::toDictionary() const {
  return RecordFieldWriter::dictionary(*this, putFields);
}

std::optional<TillDownloadAsset> TillDownloadAsset::fromDictionary(
    const PlistDictionary& dictionary) {
  std::optional<TillDownloadAsset> asset = RecordFieldReader::read(dictionary, readFields);
  if (!asset || asset->unusableReason()) return std::nullopt;
  return asset;
}

std::string TillDownloadAsset::description() const {
  return "<TillDownloadAsset: URL=" + URLRequest_.url() + " fileSize=" + std::to_string(fileSize_) +
         " chunks=" + std::to_string(hashes_.size()) + "x" + std::to_string(numberOfBytesToHash_) +
         ">";
}

}  // namespace larder
