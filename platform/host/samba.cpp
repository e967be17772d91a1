// Samba's Spotlight switch: the "spotlight" parameter of the [global] section of
// smb.conf, with the Elasticsearch backend that the indexing daemon answers, edited in
// place. Everything else in the file (comments, blank lines, other parameters and
// sections, continuation lines) is kept byte for byte.
#include <sys/stat.h>
#include <tavo/platform.h>

#include <algorithm>
#include <cctype>
#include <climits>
#include <cstdlib>
#include <string>
#include <vector>

#include "host_common.h"

namespace {

std::string ConfPath() { return tavo_host::Rooted("/etc/samba/smb.conf"); }

std::string Trim(const std::string& s) {
  size_t begin = s.find_first_not_of(" \t\r");
  if (begin == std::string::npos) return "";
  size_t end = s.find_last_not_of(" \t\r");
  return s.substr(begin, end - begin + 1);
}

std::string Lower(std::string s) {
  for (char& c : s) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  return s;
}

// Samba compares parameter names without regard to case or white space.
std::string ParameterKey(const std::string& name) {
  std::string key;
  for (char c : name) {
    if (c != ' ' && c != '\t') key += static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  }
  return key;
}

// One logical line: its physical lines (a trailing backslash continues a line).
struct Line {
  std::vector<std::string> physical;
  bool global = false;     // a parameter line (or header) within a global section
  bool header = false;     // "[section]"
  bool parameter = false;  // "name = value"
  std::string key;         // the parameter's normalised name
  std::string value;       // the parameter's value
};

struct Conf {
  std::vector<Line> lines;
  bool finalNewline = true;
};

Conf Parse(const std::string& text) {
  Conf conf;
  conf.finalNewline = text.empty() || text.back() == '\n';
  std::vector<std::string> physical;
  size_t start = 0;
  while (start < text.size()) {
    size_t end = text.find('\n', start);
    if (end == std::string::npos) end = text.size();
    physical.push_back(text.substr(start, end - start));
    start = end + 1;
  }
  bool global = true;  // parameters before the first section header are global
  for (size_t i = 0; i < physical.size();) {
    Line line;
    std::string joined;
    for (;;) {
      const std::string& part = physical[i++];
      line.physical.push_back(part);
      std::string trimmed = Trim(part);
      bool continued = !trimmed.empty() && trimmed.back() == '\\' && i < physical.size();
      joined += continued ? trimmed.substr(0, trimmed.size() - 1) : part;
      if (!continued) break;
    }
    std::string content = Trim(joined);
    if (!content.empty() && content[0] == '[') {
      size_t close = content.find(']');
      std::string section =
          Lower(Trim(content.substr(1, close == std::string::npos ? std::string::npos : close - 1)));
      global = section == "global";
      line.header = true;
    } else if (!content.empty() && content[0] != '#' && content[0] != ';') {
      size_t eq = content.find('=');
      if (eq != std::string::npos) {
        line.parameter = true;
        line.key = ParameterKey(content.substr(0, eq));
        line.value = Trim(content.substr(eq + 1));
      }
    }
    line.global = global;
    conf.lines.push_back(line);
  }
  return conf;
}

std::string Render(const Conf& conf) {
  std::string text;
  for (size_t i = 0; i < conf.lines.size(); ++i) {
    for (size_t k = 0; k < conf.lines[i].physical.size(); ++k) {
      text += conf.lines[i].physical[k];
      bool last = i + 1 == conf.lines.size() && k + 1 == conf.lines[i].physical.size();
      if (!last || conf.finalNewline) text += "\n";
    }
  }
  return text;
}

bool IsTrue(const std::string& value) {
  std::string v = Lower(value);
  return v == "yes" || v == "true" || v == "1" || v == "on";
}

// What Samba needs to send Spotlight searches to the indexing daemon's endpoint. The
// backend is the switch's own; where to reach it (and how Finder's attributes map onto
// fields) is kept when already set, so that a site may point Samba at a cluster instead.
struct Parameter {
  const char* name;
  const char* value;
  bool keepExisting;
};
const Parameter kBackend[] = {
    {"spotlight backend", "elasticsearch", false},
    {"elasticsearch:address", "127.0.0.1", true},
    {"elasticsearch:port", "9200", true},
    {"elasticsearch:mappings", "/usr/share/samba/mdssvc/elasticsearch_mappings.json", true},
};

bool IsGlobal(const Line& line, const char* name) {
  return line.parameter && line.global && line.key == ParameterKey(name);
}

// Replaces the value of a parameter line, keeping its indentation and name as written.
void SetValue(Line& line, const char* value) {
  const std::string& first = line.physical.front();
  size_t eq = first.find('=');
  std::string head = eq != std::string::npos ? first.substr(0, eq) : first;
  while (!head.empty() && (head.back() == ' ' || head.back() == '\t')) head.pop_back();
  line.physical.assign(1, head + " = " + value);
  line.value = value;
}

Line NewParameter(const std::string& indent, const char* name, const char* value) {
  Line line;
  line.physical.push_back(indent + name + " = " + value);
  line.parameter = true;
  line.global = true;
  line.key = ParameterKey(name);
  line.value = value;
  return line;
}

std::string Indent(const Line& line) {
  const std::string& first = line.physical.front();
  return first.substr(0, first.find_first_not_of(" \t"));
}

// Adds the parameter after the last parameter of the first explicit [global] section
// (after its header when it has none), else after the implicit global parameters at
// the top of the file, else in a new [global] section before the first section.
void AddGlobal(Conf& conf, const char* name, const char* value) {
  std::vector<Line>& lines = conf.lines;
  size_t firstHeader = lines.size();
  size_t globalHeader = lines.size();
  for (size_t i = 0; i < lines.size(); ++i) {
    if (!lines[i].header) continue;
    if (firstHeader == lines.size()) firstHeader = i;
    if (lines[i].global) {
      globalHeader = i;
      break;
    }
  }
  size_t after = lines.size();
  std::string indent = "\t";
  size_t from = globalHeader != lines.size() ? globalHeader + 1 : 0;
  if (globalHeader != lines.size()) after = globalHeader;
  for (size_t i = from; i < lines.size() && !lines[i].header; ++i) {
    if (lines[i].parameter) {
      after = i;
      indent = Indent(lines[i]);
    }
  }
  if (after != lines.size()) {
    lines.insert(lines.begin() + after + 1, NewParameter(indent, name, value));
    return;
  }
  Line section;
  section.physical.push_back("[global]");
  section.header = section.global = true;
  std::vector<Line> added{section, NewParameter("\t", name, value)};
  if (firstHeader != lines.size()) {
    Line blank;
    blank.physical.push_back("");
    added.push_back(blank);
  }
  lines.insert(lines.begin() + firstHeader, added.begin(), added.end());
}

// Gives every global occurrence of the parameter the value (or only adds it when missing).
void SetGlobal(Conf& conf, const char* name, const char* value, bool keepExisting) {
  bool found = false;
  for (Line& line : conf.lines) {
    if (!IsGlobal(line, name)) continue;
    if (!keepExisting) SetValue(line, value);
    found = true;
  }
  if (!found) AddGlobal(conf, name, value);
}

void RemoveGlobal(Conf& conf, const char* name) {
  auto& lines = conf.lines;
  lines.erase(
      std::remove_if(lines.begin(), lines.end(), [name](const Line& line) { return IsGlobal(line, name); }),
      lines.end());
}

// The value Samba uses: the last one given.
std::string GlobalValue(const Conf& conf, const char* name) {
  std::string value;
  for (const Line& line : conf.lines) {
    if (IsGlobal(line, name)) value = line.value;
  }
  return value;
}

}  // namespace

// Samba's default is off: a missing file or parameter reads as 0. Spotlight answered by
// anything but the Elasticsearch backend is no Spotlight for the indexing service.
extern "C" int TAVOSMBIsEnableSpotlight(void) {
  std::string text;
  if (!tavo_host::ReadFile(ConfPath(), text)) return 0;
  Conf conf = Parse(text);
  return IsTrue(GlobalValue(conf, "spotlight")) &&
                 Lower(GlobalValue(conf, "spotlight backend")) == "elasticsearch"
             ? 1
             : 0;
}

extern "C" int TAVOSMBSetSpotlight(int blEnable) {
  std::string path = ConfPath();
  char resolved[PATH_MAX];
  if (::realpath(path.c_str(), resolved) != nullptr) path = resolved;  // edit a link's target
  std::string text;
  struct stat st;
  mode_t mode = 0644;
  if (::stat(path.c_str(), &st) == 0) {
    mode = st.st_mode & 07777;
    if (!tavo_host::ReadFile(path, text)) {
      TAVO_HOST_SET_ERROR(tavo_host::kErrSamba);
      return -1;
    }
  } else if (!tavo_host::MakeDirs(path.substr(0, path.rfind('/')), 0755)) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrSamba);
    return -1;
  }
  Conf conf = Parse(text);
  SetGlobal(conf, "spotlight", blEnable ? "yes" : "no", false);
  for (const Parameter& parameter : kBackend) {
    if (blEnable) {
      SetGlobal(conf, parameter.name, parameter.value, parameter.keepExisting);
    } else {
      RemoveGlobal(conf, parameter.name);
    }
  }
  if (!tavo_host::WriteFileAtomic(path, Render(conf), mode)) {
    TAVO_HOST_SET_ERROR(tavo_host::kErrSamba);
    return -1;
  }
  return 0;
}
