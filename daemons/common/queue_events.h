// The queue-line contract between the writers of a share's event queue (the notification
// daemon tavotifyd and libfileindex) and its one consumer, fileindexd.
//
// A share's queue is the file "TAVO@file_index_queue" in the share's "@eaDir" directory
// (FILEIDXQueuePathGet). It holds one JSON object a line, ended by "\n":
//
//   {"event": CODE, "path": FULL PATH, "data": PAYLOAD}            every event
//   {"event": 256, "path": NEW FULL PATH, "path_old": OLD FULL PATH, "data": null}
//
// Writers append whole lines, one write() per line, under an exclusive flock() of the
// queue file itself, with three non-blocking tries and sleeps of 0 to 9 ms between them.
// The consumer takes the queue by renaming it, under the same lock, to its ".tmp"
// companion, applies every line in order, and removes the ".tmp" once all work is done;
// writers meanwhile append to a fresh queue. While either file exists, the service counts
// as busy for that share.
//
// Every event is a hint: the consumer looks at the file system again for the path it
// names, so applying a line twice (after a crash) or out of date is harmless.
#ifndef FILEINDEX_DAEMONS_QUEUE_EVENTS_H
#define FILEINDEX_DAEMONS_QUEUE_EVENTS_H

#include <json/json.h>

#include <cstdint>
#include <string>

namespace fileindex_queue {

enum EventCode : std::uint32_t {
  kCreated = 1,      // a file or directory appeared (also: moved in from outside the watched trees)
  kModified = 2,     // a file was written and closed
  kAttributes = 4,   // owner, mode or times changed
  kDeleted = 8,      // a file or directory went away (also: moved out of the watched trees)
  kRenamed = 256,    // moved within the watched trees: "path" is the new path, "path_old" the old one
  kReindex = 65536,  // crawl the folder "path" again and reconcile (written by the library too)
  kSettingsChanged = 131072,  // the folder "path" changed its settings (written by the library)
};

// The queue file's companion that marks work in progress.
inline std::string TmpCompanion(const std::string& queuePath) { return queuePath + ".tmp"; }

// One queue line, "\n" included. pathOld is written only for kRenamed.
std::string FormatQueueLine(std::uint32_t code, const std::string& path, const std::string& pathOld = "",
                            const Json::Value& data = Json::Value());

struct QueueEvent {
  std::uint32_t code = 0;
  std::string path;
  std::string pathOld;  // empty unless code is kRenamed
};

// Parses one line (without its "\n") the way every queue reader does: a JSON object with
// an "event" convertible to an unsigned integer and a string "path"; false otherwise.
bool ParseQueueLine(const char* line, std::size_t size, QueueEvent& event);

}  // namespace fileindex_queue

#endif
