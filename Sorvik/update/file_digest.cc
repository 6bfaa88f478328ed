#include "Sorvik/update/file_digest.h"

#include <mbedtls/md5.h>

#include <boost/interprocess/exceptions.hpp>
#include <boost/interprocess/file_mapping.hpp>
#include <boost/interprocess/mapped_region.hpp>
#include <exception>

namespace sorvik {

namespace bip = boost::interprocess;

std::string md5Hex(const void* data, size_t size) {
  unsigned char digest[16];
  // Cannot fail for the software implementation; no alternative engine is built in.
  mbedtls_md5_ret(static_cast<const unsigned char*>(data), size, digest);
  static constexpr char kHex[] = "0123456789abcdef";
  std::string hex(32, '0');
  for (int i = 0; i < 16; ++i) {
    hex[2 * i] = kHex[digest[i] >> 4];
    hex[2 * i + 1] = kHex[digest[i] & 0xF];
  }
  return hex;
}

FileDigest md5OfFile(const std::string& path) {
  FileDigest result;
  try {
    bip::file_mapping file(path.c_str(), bip::read_write);
    bip::mapped_region region(file, bip::read_write);
    if (region.get_address() == nullptr || region.get_size() == 0) {
      result.outcome = FileDigest::Outcome::NoData;
      return result;
    }
    // Read-ahead for the single front-to-back pass; only a hint.
    region.advise(bip::mapped_region::advice_sequential);
    result.hex = md5Hex(region.get_address(), region.get_size());
    result.outcome = FileDigest::Outcome::Ok;
  } catch (const bip::interprocess_exception& e) {
    result.outcome = FileDigest::Outcome::MappingFailed;
    result.error = e.what();
  } catch (const std::exception& e) {
    result.outcome = FileDigest::Outcome::Failed;
    result.error = e.what();
  }
  return result;
}

}  // namespace sorvik
