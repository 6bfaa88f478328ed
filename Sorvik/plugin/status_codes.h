#pragma once

// Status vocabularies reported to the host. They live with the host contract
// because every layer that reports to the host uses them.

#include <cstdint>

namespace ko::core {

enum StatusCode : int32_t {
  DECOMMISSION_ERROR = -103,
  NOT_PERMITTED = -102,
  INSTALL_VERIFY_FAILED = -23,
  INSTALL_NOT_SIGNED = -22,
  INSTALL_TIMEOUT = -21,
  INSTALL_ERROR = -20,
  CURL_CERTIFICATE_ERROR = -18,
  DOWNLOAD_PARSER_ERROR = -17,
  DOWNLOAD_FILE_IO_ERROR = -16,
  DOWNLOAD_NETWORK_ERROR = -15,
  DOWNLOAD_SSL_ERROR = -14,
  DOWNLOAD_AUTH_ERROR = -13,
  DOWNLOAD_PROTOCOL_ERROR = -12,
  DOWNLOAD_HOST_ERROR = -11,
  DOWNLOAD_ERROR = -10,
  INVALID_PATH_URI = -6,
  INVALID_HOST_NAME = -5,
  CHECKSUM_FAILED = -4,
  INVALID_URI_LOCATION = -3,
  NO_BUNDLE_NAME = -2,
  UPDATE_FAILED = -1,
  NO_UPDATE = 0,
  BUNDLE_DOWNLOAD = 1,
  BUNDLE_INSTALL = 2,
  PENDING_UPDATE = 3,
  BUNDLE_FILE = 4,
  UPDATE_SUCCESS = 13,
  PROTECTED = 100,
  DECOMMISSION_PENDING = 101,
  DECOMMISSION_FAILOVER = 102,
  DECOMMISSION_ACTIVE = 103,
  COMMISSIONED = 104,
  RESERVE_SPARE = 105,
};

enum AgentStatus : int32_t {
  AGENT_NONE = 200,
  AGENT_PENDING = 201,
  AGENT_READY = 202,
  AGENT_INPROGRESS = 203,
  AGENT_ERROR = 204,
  AGENT_COMPLETED = 205,
};

// "UNKNOWN_STATUS" for values outside the table.
const char* statusCodeName(int32_t code);
// "NONE" for values outside 201..205.
const char* agentStatusName(int32_t code);

}  // namespace ko::core
