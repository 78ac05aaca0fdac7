// SPDX-License-Identifier: Apache-2.0
// The handlers of kestrelctl's commands, by what they do: exchanges of command frames, streams
// and listens, captures.
#pragma once

#include "command_table.h"

namespace kestrelctl {

// Sends one command frame, the command's number with its words and the sensors of its
// arguments; waits for one of its replies when it has any.
int exchange(Session& session, const Command& command);
int selftest(Session& session, const Command& command);
int dump(Session& session, const Command& command);
int calib_store(Session& session, const Command& command);
int bigdata(Session& session, const Command& command);
int send_words(Session& session, const Command& command);
int send_raw(Session& session, const Command& command);
int hh_set(Session& session, const Command& command);

int stream(Session& session, const Command& command);
int listen(Session& session, const Command& command);

int decode_file(Session& session, const Command& command);
int decode_live(Session& session, const Command& command);

}  // namespace kestrelctl
