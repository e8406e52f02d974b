#include "ipc/daemon-ipc.h"

#include <utility>

#include "common/log.h"
#include "common/paths.h"
#include "ipc/simple-ipc.h"

DaemonIPC::DaemonIPC() : m_socket_path(Plovo::Path::DaemonSocket()) {}

std::string DaemonIPC::LogText(const PObject& value) {
  std::string text = value.toString();
  if (text.size() <= kLogTextLimit) return text;
  const size_t whole = text.size();
  text.resize(kLogTextLimit);
  return text + "... (" + std::to_string(whole) + " bytes in all)";
}

int DaemonIPC::SendCommand(const PObject& request, PObject& response) {
  const bool trace = Plovo::LogWillWrite(LOG_DEBUG);
  IPCSender sender;
  sender.channel().SetDeadline(m_time_limit);
  if (sender.connect(m_socket_path) != 0) {
    PLOVO_LIB_ERR("Failed to connect at '%s'", m_socket_path.c_str());
    return -1;
  }
  if (sender.send(request) != 0) {
    PLOVO_LIB_ERR("Failed to send request.");
    return -1;
  }
  if (trace) PLOVO_LIB_DBG("DaemonIPC: send request >>> %s", LogText(request).c_str());
  if (request.hasMember("need_ack") && !request["need_ack"].asBool()) {
    PLOVO_LIB_DBG("DaemonIPC: no need ack");
    return 0;
  }
  // Received apart and handed over only whole: a receive that fails half
  // way must not leave an "error_code" or a "task_id" for the caller to read.
  PObject answer;
  if (sender.recv(answer) != 0) {
    response.clear();
    PLOVO_LIB_ERR("Failed to receive response.");
    return -1;
  }
  response = std::move(answer);
  if (trace) PLOVO_LIB_DBG("DaemonIPC: recv response <<< %s", LogText(response).c_str());
  if (response.hasMember("error")) {
    PLOVO_LIB_ERR("SendCommand error: %s", LogText(std::as_const(response)["error"]).c_str());
    return -1;
  }
  // Read through a const view: the caller's answer must not gain an "ack".
  if (std::as_const(response)["ack"].asString() == "ok") {
    PLOVO_LIB_DBG("Recieve ack.");
    return 0;
  }
  PLOVO_LIB_ERR("Can not recieve ack.");
  return -1;
}
