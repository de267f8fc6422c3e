// Resource figures of a running process as Linux shows them under /proc:
// open descriptors, memory mappings and resident memory. Used by the soak
// program and its short test to see that serving requests leaves them flat.
#pragma once

#include <dirent.h>
#include <sys/types.h>

#include <cstdio>
#include <fstream>
#include <string>
#include <vector>

struct ProcStats {
  long fds = -1;       // entries of /proc/PID/fd
  long mappings = -1;  // lines of /proc/PID/maps
  long rss_kb = -1;    // VmRSS of /proc/PID/status
};

inline long proc_count_entries(const std::string& dir) {
  DIR* d = opendir(dir.c_str());
  if (d == nullptr) return -1;
  long n = 0;
  while (const dirent* e = readdir(d)) {
    if (e->d_name[0] != '.') ++n;
  }
  closedir(d);
  return n;
}

inline long proc_count_lines(const std::string& path) {
  std::ifstream in(path);
  if (!in) return -1;
  long n = 0;
  std::string line;
  while (std::getline(in, line)) ++n;
  return n;
}

inline long proc_rss_kb(pid_t pid) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/status");
  std::string line;
  while (std::getline(in, line)) {
    long kb = 0;
    if (std::sscanf(line.c_str(), "VmRSS: %ld kB", &kb) == 1) return kb;
  }
  return -1;
}

// The figures of `pid`; -1 in each field that could not be read.
inline ProcStats proc_stats(pid_t pid) {
  const std::string base = "/proc/" + std::to_string(pid);
  return {proc_count_entries(base + "/fd"), proc_count_lines(base + "/maps"), proc_rss_kb(pid)};
}

// The children of `pid` (its main thread's), oldest first.
inline std::vector<pid_t> proc_children(pid_t pid) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/task/" + std::to_string(pid) + "/children");
  std::vector<pid_t> children;
  long child = 0;
  while (in >> child) children.push_back(static_cast<pid_t>(child));
  return children;
}
