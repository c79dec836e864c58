#pragma once

#include <string>

#include "examples/webdav-provider/DavClient.h"
#include "platform/Result.h"

namespace storix::example {

/// Reads "WebDAV.kvs" in the group container, a keyed-value file with
///   "URL"              the collection to serve, https (or http), without name and password
///   "CredentialsFile"  optional: a path, absolute or relative to the container;
///                      "WebDAV Credentials.kvs" where nothing is said, and then it may be missing
///   "AllowPlainHTTP"   optional: true lets the password travel unencrypted to another machine
/// and the credentials file, a keyed-value file with "Name" and "Password", which must belong to the
/// user and be closed to everybody else. An error says what is wrong and what to do, and never holds
/// what is in the credentials file.
Result<DavSettings> readConfiguration(const std::string &groupContainer);

}  // namespace storix::example
