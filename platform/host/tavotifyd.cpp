// The notification-daemon client: each share's watch list is a JSON file under
// /run/tavotifyd/<name>/, named after the queue path.
#include <sys/stat.h>
#include <tavo/tavotifyd.h>
#include <unistd.h>

#include <cerrno>
#include <fstream>
#include <stdexcept>

#include "host_common.h"

namespace TAVO {
namespace TAVOTIFYD {

namespace {

std::string WatchListPath(const std::string& queuePath, const std::string& name) {
  std::string key = queuePath;
  for (char& c : key) {
    if (c == '/') c = '_';
  }
  return tavo_host::Rooted("/run/tavotifyd/" + name + "/" + key + ".json");
}

}  // namespace

MonitorQueue::MonitorQueue(const Json::Value& config) : m_config(config) {
  if (!config.isObject() || !config["queue"].isString() || !config["config"].isArray())
    throw std::invalid_argument("malformed monitor queue");
}

MonitorQueue::~MonitorQueue() {}

MonitorQueue::MonitorQueue(const MonitorQueue& other) : m_config(other.m_config) {}

MonitorQueue& MonitorQueue::operator=(const MonitorQueue& other) {
  m_config = other.m_config;
  return *this;
}

const Json::Value& MonitorQueue::GetConfig() const { return m_config; }

int MonitorQueue::Upsert(const MonitorQueue& queue, const std::string& name, _tag_monitor_queue_type_ type) {
  const std::string dir = tavo_host::Rooted("/run/tavotifyd/" + name);
  ::mkdir(tavo_host::Rooted("/run/tavotifyd").c_str(), 0755);
  ::mkdir(dir.c_str(), 0755);
  Json::Value document = queue.GetConfig();
  document["name"] = name;
  document["type"] = static_cast<int>(type);
  const std::string path = WatchListPath(queue.GetConfig()["queue"].asString(), name);
  const std::string tmp = path + ".tmp";
  {
    std::ofstream out(tmp, std::ios::trunc);
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "  ";
    out << Json::writeString(builder, document) << "\n";
    if (!out) return 0;
  }
  return ::rename(tmp.c_str(), path.c_str()) == 0 ? 1 : 0;
}

int MonitorQueue::Delete(const std::string& queuePath, const std::string& name, _tag_monitor_queue_type_) {
  const std::string path = WatchListPath(queuePath, name);
  if (::unlink(path.c_str()) != 0 && errno != ENOENT) return 0;
  return 1;
}

}  // namespace TAVOTIFYD
}  // namespace TAVO
