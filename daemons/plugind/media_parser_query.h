// Asking the media parser about one file for a peer, within a time limit.
//
// The media parser answers a process only about files that process could
// read itself, judged by the credentials the kernel records when it
// connects. So the daemon connects to it with the peer's credentials: for
// the connect, the calling thread's effective user, group and supplementary
// groups are the peer's (set with the raw system calls, which change this
// thread alone), and the media parser opens the file as the peer. Whatever
// is renamed or swapped at the path meanwhile, it can show the peer nothing
// the peer could not read itself.
//
// The whole exchange (connecting, asking, the reply) takes at most the
// configured seconds, and ends at once when the daemon stops. A media
// parser that accepts and never answers, or answers half a packet, costs no
// more.
#ifndef QUVAIDX_DAEMONS_PLUGIND_MEDIA_PARSER_QUERY_H_
#define QUVAIDX_DAEMONS_PLUGIND_MEDIA_PARSER_QUERY_H_

#include <string>

#include <json/json.h>

#include "plugin_requests.h"

namespace plugind {

// Sends {"command": "GET_MEDIA_INFO", "path": path} to the media parser of
// `config` (which must run as root or as `peer`'s user) on a connection made
// with `peer`'s credentials (the daemon's own for root and the daemon's own
// user), and stores the reply's "media" in *media.
// Returns "" on success; else why not: "the media parser does not answer
// (REASON)", "the media parser cannot read the file: REASON" (its own
// refusal), "cannot take the rights of the asking process", or "the daemon
// is stopping".
std::string AskMediaInfo(const PluginConfig& config,
                         const quvaidx_daemons::FsUser& peer,
                         const std::string& path, Json::Value* media);

// Connects to the daemon at `path` as ConnectDaemon does, with `peer`'s
// effective user, group and supplementary groups on the calling thread for
// the connect, the thread's own restored before returning (this needs
// CAP_SETUID and CAP_SETGID). Returns the descriptor; -1 with
// ConnectDaemon's errno; or -2 when the credentials could not be taken.
int ConnectAs(const quvaidx_daemons::FsUser& peer, const std::string& path,
              int timeout_ms);

}  // namespace plugind

#endif  // QUVAIDX_DAEMONS_PLUGIND_MEDIA_PARSER_QUERY_H_
