// `logmgrctl outbox`: the relay library's outbox, one block per handed-over record, the body
// split into its key=value pairs.
#include "tools/logmgrctl/outbox_view.h"

#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <time.h>

#include <fstream>
#include <map>
#include <string>

#include "platform/fixed_path.h"

namespace {

constexpr char kOutbox[] = "/opt/usr/data/log-relay/outbox.jsonl";
constexpr char kSeparator[] = "\xC2\xB6";

// Reads one JSON string starting at the opening quote; false on malformed text.
bool ParseString(const std::string& line, size_t* pos, std::string* out) {
  if (*pos >= line.size() || line[*pos] != '"') return false;
  out->clear();
  for (size_t i = *pos + 1; i < line.size(); ++i) {
    char c = line[i];
    if (c == '"') {
      *pos = i + 1;
      return true;
    }
    if (c != '\\') {
      out->push_back(c);
      continue;
    }
    if (++i >= line.size()) return false;
    switch (line[i]) {
      case 'n':
        out->push_back('\n');
        break;
      case 't':
        out->push_back('\t');
        break;
      case 'r':
        out->push_back('\r');
        break;
      case 'u':
        if (i + 4 >= line.size()) return false;
        out->push_back(static_cast<char>(strtol(line.substr(i + 1, 4).c_str(), nullptr, 16)));
        i += 4;
        break;
      default:
        out->push_back(line[i]);
    }
  }
  return false;
}

void SkipBlanks(const std::string& line, size_t* pos) {
  while (*pos < line.size() && (line[*pos] == ' ' || line[*pos] == '\t')) ++*pos;
}

}  // namespace

bool ParseOutboxRecord(const std::string& line, std::map<int, std::string>* items) {
  size_t pos = 0;
  SkipBlanks(line, &pos);
  if (pos >= line.size() || line[pos++] != '{') return false;
  for (;;) {
    SkipBlanks(line, &pos);
    if (pos < line.size() && line[pos] == '}') return true;
    std::string key, value;
    if (!ParseString(line, &pos, &key)) return false;
    SkipBlanks(line, &pos);
    if (pos >= line.size() || line[pos++] != ':') return false;
    SkipBlanks(line, &pos);
    if (pos < line.size() && line[pos] == '"') {
      if (!ParseString(line, &pos, &value)) return false;
    } else {
      size_t end = line.find_first_of(",} ", pos);
      if (end == std::string::npos) return false;
      value = line.substr(pos, end - pos);
      pos = end;
    }
    (*items)[atoi(key.c_str())] = value;
    SkipBlanks(line, &pos);
    if (pos < line.size() && line[pos] == ',') ++pos;
  }
}

namespace {

std::string RenderTime(const std::string& ms) {
  if (ms.empty()) return "-";
  time_t seconds = static_cast<time_t>(strtoll(ms.c_str(), nullptr, 10) / 1000);
  struct tm tm;
  char text[64];
  if (localtime_r(&seconds, &tm) == nullptr ||
      strftime(text, sizeof(text), "%Y-%m-%d %H:%M:%S %z", &tm) == 0) {
    return ms;
  }
  return text;
}

}  // namespace

int RunOutboxCommand(int argc, char** argv) {
  (void)argc;
  (void)argv;
  char buf[4096];
  const char* path = logmgr_fixed_path(kOutbox, buf, sizeof(buf));
  std::ifstream in(path);
  if (!in) {
    printf("outbox %s: no records\n", path);
    return 0;
  }
  int number = 0;
  for (std::string line; std::getline(in, line);) {
    if (line.empty()) continue;
    ++number;
    std::map<int, std::string> items;
    if (!ParseOutboxRecord(line, &items)) {
      printf("#%d  unreadable line: %s\n", number, line.c_str());
      continue;
    }
    printf("#%d  %s  activity %s  svc %s  type %s  version %s  app %s\n", number,
           RenderTime(items[3]).c_str(), items[4].c_str(), items[2].c_str(), items[1].c_str(),
           items[6].c_str(), items[8].c_str());
    const std::string& body = items[7];
    for (size_t start = 0; start <= body.size();) {
      size_t end = body.find(kSeparator, start);
      if (end == std::string::npos) end = body.size();
      printf("    %s\n", body.substr(start, end - start).c_str());
      start = end + strlen(kSeparator);
    }
  }
  if (number == 0) printf("outbox %s: no records\n", path);
  return 0;
}
