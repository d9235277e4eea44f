#include "tools/vitdctl/session.h"

#include <sys/stat.h>

#include <algorithm>
#include <cstdlib>
#include <memory>
#include <string>

#include "tools/vitdctl/status.h"

namespace vtr::vitdctl {
namespace {

void DrawProgress(FILE* out, int64_t percent) {
  constexpr int kWidth = 40;
  const int64_t shown = percent < 0 ? 0 : (percent > 100 ? 100 : percent);
  const int filled = static_cast<int>(shown * kWidth / 100);
  // The helper's percent may pass 100 (--json shows it as sent); the bar
  // stops at full.
  std::fprintf(out, "\r[%s%s] %3lld%%", std::string(filled, '#').c_str(), std::string(kWidth - filled, '-').c_str(),
               static_cast<long long>(shown));
  std::fflush(out);
}

// What a helper that stops answering usually means: after some responses,
// a request key it does not know; before any, a client it does not entitle.
void ExplainSilence(size_t responses) {
  if (responses > 0) {
    std::fprintf(stderr, "vitdctl: the helper sends no response to a request key it does not know\n");
    return;
  }
  struct stat self;
  if (::stat("/proc/self/exe", &self) == 0 && (self.st_uid != 0 || (self.st_mode & (S_IWGRP | S_IWOTH)) != 0)) {
    std::fprintf(stderr,
                 "vitdctl: this vitdctl is not entitled: the helper honours its entitlement only when the\n"
                 "  executable is owned by root and not writable by group or others (it is owned by uid %u,\n"
                 "  mode %03o); install it as root, e.g. mode 0750\n",
                 static_cast<unsigned>(self.st_uid), static_cast<unsigned>(self.st_mode & 07777));
    return;
  }
  std::fprintf(stderr,
               "vitdctl: the helper answers nothing to a client that is not entitled (its executable must be\n"
               "  root-owned, not writable by others, and carry the helper's entitlement) nor to a request\n"
               "  key it does not know; see the helper's log for the reason\n");
}

struct Progress {
  const SessionOptions* options;
  const vitd_value* request;
  FILE* out;
  size_t responses = 0;
  bool allTrue = true;
  bool barShown = false;
};

int PrintMessage(const vitd_message* message, void* context) {
  auto* state = static_cast<Progress*>(context);
  if (state->options->progressBar && message->kind == VITD_MESSAGE_PROGRESS) {
    DrawProgress(state->out, message->progress);
    state->barShown = true;
    return 0;
  }
  if (state->barShown) {
    std::fputc('\n', state->out);
    state->barShown = false;
  }
  char* json = vitd_value_to_json(message->object);
  if (state->options->label) {
    // The key without its colon: the command as typed.
    const char* key = vitd_dictionary_key(state->request, state->responses);
    const std::string command = key != nullptr ? std::string(key).substr(0, std::string(key).find(':')) : "?";
    std::fprintf(state->out, "%s: ", command.c_str());
  }
  std::fprintf(state->out, "%s\n", json != nullptr ? json : "{}");
  std::free(json);
  std::fflush(state->out);
  if (message->kind == VITD_MESSAGE_RESPONSE) {
    ++state->responses;
    if (message->response == 0) state->allTrue = false;
  }
  return 0;
}

}  // namespace

int RunSession(const SessionOptions& options, const vitd_value& request, FILE* out) {
  vitd_client* client = nullptr;
  if (int status = vitd_connect(options.socketPath.c_str(), &client); status != VITD_OK) {
    const std::string reason = status == VITD_ERROR_CONNECT ? ConnectFailure(options.socketPath) : "";
    std::fprintf(stderr, "vitdctl: cannot connect to %s: %s\n", options.socketPath.c_str(),
                 reason.empty() ? vitd_strerror(status) : reason.c_str());
    if (!options.howToStart.empty()) std::fprintf(stderr, "  %s\n", options.howToStart.c_str());
    return kExitUnavailable;
  }
  std::unique_ptr<vitd_client, void (*)(vitd_client*)> owned(client, vitd_disconnect);
  vitd_set_timeout(client, static_cast<int>(std::min<int64_t>(options.timeout.count(), INT32_MAX)));
  if (int status = vitd_send_request(client, &request); status != VITD_OK) {
    std::fprintf(stderr, "vitdctl: cannot send the request: %s\n", vitd_strerror(status));
    return kExitUnavailable;
  }

  const size_t expected = vitd_value_count(&request);
  Progress state{&options, &request, out};
  while (state.responses < expected) {
    const int status = vitd_receive(client, PrintMessage, &state);
    if (status == VITD_OK) continue;
    if (state.barShown) std::fputc('\n', out);
    if (options.closeIsSuccess && status == VITD_ERROR_CLOSED && state.responses == 0) {
      std::fprintf(stderr, "vitdctl: the helper ended the connection without a reply, as this command does\n");
      return kExitOk;
    }
    std::fprintf(stderr, "vitdctl: %s after %zu of %zu responses\n", vitd_strerror(status), state.responses,
                 expected);
    if (status == VITD_ERROR_TIMEOUT || status == VITD_ERROR_CLOSED) ExplainSilence(state.responses);
    return kExitNoAnswer;
  }
  if (state.allTrue) return kExitOk;
  if (!options.whereReasonsAre.empty()) {
    std::fprintf(stderr, "vitdctl: the helper answered false; why: %s\n", options.whereReasonsAre.c_str());
  }
  return kExitNo;
}

}  // namespace vtr::vitdctl
