// A JSON configuration file guarded by an advisory lock file.
#ifndef FILEINDEX_CONFIG_H
#define FILEINDEX_CONFIG_H

#include <json/json.h>

#include <string>

namespace TAVO {
namespace FILEINDEX {

class Config {
 public:
  Config();
  // Destroys the document only; the lock is released by an explicit Unlock().
  virtual ~Config();

  // Reads the file into the subclass's members.
  virtual bool Load() = 0;
  // Writes the subclass's members to the file.
  virtual bool Save() = 0;
  // Path of the lock file.
  virtual std::string GetLockPath() const = 0;
  // Path of the JSON file.
  virtual std::string GetPath() const = 0;

  // Takes the flock (exclusive or shared) in three non-blocking tries; error 9 on failure.
  bool Lock(bool exclusive);
  // Releases the lock and closes the descriptor; does nothing when never opened.
  void Unlock();
  // Reads GetPath() into the document; a missing file is an empty document, a bad one error 6.
  bool LoadJson();
  // Writes the document to GetPath() atomically with mode 0644; error 7 on failure.
  bool SaveJson();

 protected:
  Json::Value m_jsDocument;
  int m_fdLock;
};

}  // namespace FILEINDEX
}  // namespace TAVO

#endif
