#include "HostMessages.h"

#include <cstdio>

#include "DebugTrace.h"
#include "MessageNames.h"

namespace {

constexpr std::size_t kLongestTrace = 2048;

}  // namespace

void SendErrorMessage(int id, int code, const char* text) {
  KtLuaTETable data;
  if (text != nullptr) {
    char line[kLongestTrace];
    std::snprintf(line, sizeof line, "SendErrorMessage - error code: %xd, message: %s", static_cast<unsigned>(code),
                  text);
    debugmsg(line);
  } else {
    debugmsgint("SendErrorMessage - error code: %xd", code);
  }
  data.Set(kKeyErrorCode, new KtLuaTENumber(code));
  if (text != nullptr) data.Set(kKeyErrorDescription, new KtLuaTEString(text));
  SendMessageToClient(id, kMessageError, &data);
}
