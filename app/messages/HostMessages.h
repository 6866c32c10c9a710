// The one way to the host. Any thread; each message reaches the pipe whole.
#pragma once

#include "KtLuaTableMarshalling.h"

// Sends a message; `data` stays the caller's and may be null for no payload. The id is cut to 32 bits: a request's id
// in its answer, 0 in a notification. Blocks while the host does not read.
void SendMessageToClient(long id, const char* name, KtLuaTETable* data);

// Answers the request of that id with "error". `text` may be null.
void SendErrorMessage(int id, int code, const char* text);
