// Asking the media parser about one file, within a time limit: the whole
// exchange (connecting, asking, the reply) takes at most the configured
// seconds, and ends at once when the daemon stops. A media parser that
// accepts and never answers, or answers half a packet, costs no more.
#ifndef QUVAIDX_DAEMONS_PLUGIND_MEDIA_PARSER_QUERY_H_
#define QUVAIDX_DAEMONS_PLUGIND_MEDIA_PARSER_QUERY_H_

#include <string>

#include <json/json.h>

#include "plugin_requests.h"

namespace plugind {

// Sends {"command": "GET_MEDIA_INFO", "path": path} to the media parser of
// `config` (which must run as root or as this process's user) and stores
// the reply's "media" in *media.
// Returns "" on success; else why not: "the media parser does not answer
// (REASON)", "the media parser cannot read the file: REASON" (its own
// refusal), or "the daemon is stopping".
std::string AskMediaInfo(const PluginConfig& config, const std::string& path,
                         Json::Value* media);

}  // namespace plugind

#endif  // QUVAIDX_DAEMONS_PLUGIND_MEDIA_PARSER_QUERY_H_
