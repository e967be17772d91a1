// The notification-daemon client: each watch list is a JSON file
//   <root>/run/tavotifyd/<queue name>/<queue path without the root>.json
// so that a queue's file is found from its name and path alone, and removed on delete.
#include <tavo/tavotifyd.h>
#include <unistd.h>

#include <cerrno>
#include <stdexcept>
#include <string>

#include "host_common.h"

namespace TAVO {
namespace TAVOTIFYD {

namespace {

std::string NameDirectory(const std::string& name) { return tavo_host::Rooted("/run/tavotifyd/" + name); }

// Empty when the name or the queue path cannot name a file safely.
std::string WatchListPath(const std::string& queuePath, const std::string& name) {
  if (name.empty() || name == "." || name == ".." || name.find('/') != std::string::npos) return "";
  const std::string relative = tavo_host::Unrooted(queuePath);
  if (relative.size() < 2 || relative[0] != '/' || relative.back() == '/') return "";
  if (relative.find("/../") != std::string::npos || relative.find("/./") != std::string::npos ||
      relative.compare(relative.size() - 3, 3, "/..") == 0 || relative.find("//") != std::string::npos) {
    return "";
  }
  return NameDirectory(name) + relative + ".json";
}

bool IsValidEntry(const Json::Value& entry) {
  if (!entry.isObject() || !entry["path"].isString() || !entry["mask"].isIntegral()) return false;
  if (!entry.isMember("ignore")) return true;
  if (!entry["ignore"].isArray()) return false;
  for (const Json::Value& name : entry["ignore"]) {
    if (!name.isString()) return false;
  }
  return true;
}

}  // namespace

MonitorQueue::MonitorQueue(const Json::Value& config) : m_config(config) {
  if (!config.isObject() || !config["queue"].isString() || !config["config"].isArray())
    throw std::invalid_argument("malformed monitor queue: " + config.toStyledString());
  for (const Json::Value& entry : config["config"]) {
    if (!IsValidEntry(entry)) throw std::invalid_argument("malformed watch entry: " + entry.toStyledString());
  }
}

MonitorQueue::~MonitorQueue() {}

MonitorQueue::MonitorQueue(const MonitorQueue& other) : m_config(other.m_config) {}

MonitorQueue& MonitorQueue::operator=(const MonitorQueue& other) {
  m_config = other.m_config;
  return *this;
}

const Json::Value& MonitorQueue::GetConfig() const { return m_config; }

int MonitorQueue::Upsert(const MonitorQueue& queue, const std::string& name, _tag_monitor_queue_type_ type) {
  const std::string path = WatchListPath(queue.GetConfig()["queue"].asString(), name);
  if (path.empty()) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrBadArgument);
    return 0;
  }
  Json::Value document = queue.GetConfig();
  document["name"] = name;
  document["type"] = static_cast<int>(type);
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  builder["emitUTF8"] = true;
  if (!tavo_host::MakeDirs(path.substr(0, path.rfind('/')), 0755) ||
      !tavo_host::WriteFileAtomic(path, Json::writeString(builder, document) + "\n", 0644)) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrMonitorQueue);
    return 0;
  }
  return 1;
}

// Removing a queue that is not there succeeds; directories left empty go with it.
int MonitorQueue::Delete(const std::string& queuePath, const std::string& name, _tag_monitor_queue_type_) {
  const std::string path = WatchListPath(queuePath, name);
  if (path.empty()) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrBadArgument);
    return 0;
  }
  if (::unlink(path.c_str()) != 0 && errno != ENOENT) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrMonitorQueue);
    return 0;
  }
  const std::string top = NameDirectory(name);
  for (std::string dir = path.substr(0, path.rfind('/')); dir.size() > top.size();
       dir = dir.substr(0, dir.rfind('/'))) {
    if (::rmdir(dir.c_str()) != 0) break;
  }
  return 1;
}

}  // namespace TAVOTIFYD
}  // namespace TAVO
