#include "ipc/command-server.h"

#include <sys/socket.h>
#include <unistd.h>

#include <utility>

#include "common/no-throw.h"

// ---- CommandServer::Connection ----------------------------------------------

bool CommandServer::Connection::Adopt() {
  if (m_adopted) return true;
  if (m_sender.assign(m_fd) != 0) return false;
  m_owned.release();
  m_adopted = true;
  m_sender.channel().SetDeadline(kTimeLimit);
  return true;
}

int CommandServer::Connection::Recv(PObject& message) { return Adopt() ? m_sender.recv(message) : -1; }

int CommandServer::Connection::Send(const PObject& message) { return Adopt() ? m_sender.send(message) : -1; }

// ---- CommandServer ----------------------------------------------------------

CommandServer::CommandServer(const std::vector<Command>& commands, Handler unknown, Report report)
    : m_unknown(std::move(unknown)), m_report(std::move(report)) {
  for (const Command& command : commands) m_commands[command.action] = command.handler;
  m_hook = [this](Connection& connection) { Exchange(connection); };
}

CommandServer::CommandServer(ConnectionHook hook) : m_hook(std::move(hook)) {}

int CommandServer::Start(const std::string& path) {
  if (m_listener.prepare(path) != 0) return -1;
  // How often an idle worker looks at the stop flag.
  m_listener.setTimeout({0, 50000});
  for (int i = 0; i < kWorkers; ++i) m_workers.emplace_back(&CommandServer::Work, this);
  return 0;
}

void CommandServer::Stop() {
  if (m_workers.empty()) return;
  m_stopping = true;
  {
    // A connection still being served has its socket shut down, which ends
    // any read or wait on it at once.
    std::lock_guard<std::mutex> lock(m_mutex);
    for (int fd : m_serving) shutdown(fd, SHUT_RDWR);
  }
  for (std::thread& worker : m_workers) worker.join();
  m_workers.clear();
  m_listener.close();
}

int CommandServer::NextConnection() {
  std::lock_guard<std::mutex> accepting(m_accepting);
  while (!m_stopping) {
    if (!m_listener.isReady()) continue;
    const int fd = m_listener.accept();
    if (fd < 0) continue;
    // Under m_mutex, so that a Stop either sees this connection or is seen
    // here.
    std::lock_guard<std::mutex> lock(m_mutex);
    if (m_stopping) {
      close(fd);
      break;
    }
    m_serving.insert(fd);
    return fd;
  }
  return -1;
}

void CommandServer::Work() {
  for (int fd; (fd = NextConnection()) >= 0;) {
    Connection connection(fd);
    // One broken request must not take the daemon down with it.
    Plovo::NoThrow([&] { m_hook(connection); return true; }, false);
    // Before the connection closes the socket: Stop must not shut down a
    // descriptor number that the process has meanwhile given to another file.
    std::lock_guard<std::mutex> lock(m_mutex);
    m_serving.erase(fd);
  }
}

void CommandServer::Exchange(Connection& connection) {
  PObject received;
  if (connection.Recv(received) != 0) {
    if (m_report) m_report("unreadable request");
    return;
  }
  const PObject& request = received;
  const std::string& action = request["action"].asStringRef();
  auto command = m_commands.find(action);
  const PObject answer = (command != m_commands.end() ? command->second : m_unknown)(request);
  const bool wanted = !request.hasMember("need_ack") || request["need_ack"].asBool();
  if (!wanted || answer.isNull()) return;
  if (connection.Send(answer) != 0 && m_report) m_report("the answer to " + action + " could not be sent");
}
