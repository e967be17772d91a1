// Client of the file-notification daemon: watch queues.
#ifndef TAVO_TAVOTIFYD_H
#define TAVO_TAVOTIFYD_H

#include <json/json.h>

#include <string>

namespace TAVO {
namespace TAVOTIFYD {

enum _tag_monitor_queue_type_ {
  MONITOR_QUEUE_TYPE_NONE = 0,
  MONITOR_QUEUE_TYPE_FILE = 1,
};

class MonitorQueue {
 public:
  // Builds a queue description {"queue": path, "config": [...]}; throws on a malformed one.
  explicit MonitorQueue(const Json::Value& config);
  ~MonitorQueue();
  MonitorQueue(const MonitorQueue& other);
  MonitorQueue& operator=(const MonitorQueue& other);

  const Json::Value& GetConfig() const;

  // Creates or replaces the named queue; non-zero on success.
  static int Upsert(const MonitorQueue& queue, const std::string& name, _tag_monitor_queue_type_ type);
  // Removes the named queue of that queue path; non-zero on success.
  static int Delete(const std::string& queuePath, const std::string& name, _tag_monitor_queue_type_ type);

 private:
  Json::Value m_config;
};

}  // namespace TAVOTIFYD
}  // namespace TAVO

#endif
