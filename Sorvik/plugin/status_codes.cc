#include "Sorvik/plugin/status_codes.h"

namespace ko::core {

const char* statusCodeName(int32_t code) {
  switch (code) {
    case DECOMMISSION_ERROR: return "DECOMMISSION_ERROR";
    case NOT_PERMITTED: return "NOT_PERMITTED";
    case INSTALL_VERIFY_FAILED: return "INSTALL_VERIFY_FAILED";
    case INSTALL_NOT_SIGNED: return "INSTALL_NOT_SIGNED";
    case INSTALL_TIMEOUT: return "INSTALL_TIMEOUT";
    case INSTALL_ERROR: return "INSTALL_ERROR";
    case CURL_CERTIFICATE_ERROR: return "CURL_CERTIFICATE_ERROR";
    case DOWNLOAD_PARSER_ERROR: return "DOWNLOAD_PARSER_ERROR";
    case DOWNLOAD_FILE_IO_ERROR: return "DOWNLOAD_FILE_IO_ERROR";
    case DOWNLOAD_NETWORK_ERROR: return "DOWNLOAD_NETWORK_ERROR";
    case DOWNLOAD_SSL_ERROR: return "DOWNLOAD_SSL_ERROR";
    case DOWNLOAD_AUTH_ERROR: return "DOWNLOAD_AUTH_ERROR";
    case DOWNLOAD_PROTOCOL_ERROR: return "DOWNLOAD_PROTOCOL_ERROR";
    case DOWNLOAD_HOST_ERROR: return "DOWNLOAD_HOST_ERROR";
    case DOWNLOAD_ERROR: return "DOWNLOAD_ERROR";
    case INVALID_PATH_URI: return "INVALID_PATH_URI";
    case INVALID_HOST_NAME: return "INVALID_HOST_NAME";
    case CHECKSUM_FAILED: return "CHECKSUM_FAILED";
    case INVALID_URI_LOCATION: return "INVALID_URI_LOCATION";
    case NO_BUNDLE_NAME: return "NO_BUNDLE_NAME";
    case UPDATE_FAILED: return "UPDATE_FAILED";
    case NO_UPDATE: return "NO_UPDATE";
    case BUNDLE_DOWNLOAD: return "BUNDLE_DOWNLOAD";
    case BUNDLE_INSTALL: return "BUNDLE_INSTALL";
    case PENDING_UPDATE: return "PENDING_UPDATE";
    case BUNDLE_FILE: return "BUNDLE_FILE";
    case UPDATE_SUCCESS: return "UPDATE_SUCCESS";
    case PROTECTED: return "PROTECTED";
    case DECOMMISSION_PENDING: return "DECOMMISSION_PENDING";
    case DECOMMISSION_FAILOVER: return "DECOMMISSION_FAILOVER";
    case DECOMMISSION_ACTIVE: return "DECOMMISSION_ACTIVE";
    case COMMISSIONED: return "COMMISSIONED";
    case RESERVE_SPARE: return "RESERVE_SPARE";
    default: return "UNKNOWN_STATUS";
  }
}

const char* agentStatusName(int32_t code) {
  switch (code) {
    case AGENT_PENDING: return "PENDING";
    case AGENT_READY: return "READY";
    case AGENT_INPROGRESS: return "INPROGRESS";
    case AGENT_ERROR: return "ERROR";
    case AGENT_COMPLETED: return "COMPLETED";
    default: return "NONE";
  }
}

}  // namespace ko::core
