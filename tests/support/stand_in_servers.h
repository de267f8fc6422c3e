// The stand-in servers as RAII owners: started on a kernel-chosen port (read
// from their first line), set and counted through their control routes (see
// docs/stand-in-servers.md), stopped and reaped when they go.
#pragma once

#include <sys/types.h>

#include <map>
#include <string>
#include <utility>
#include <vector>

// Lower-case hex MD5 of `query` + `key`: the item-list signature, computed
// with GLib rather than the service's own routine.
std::string stand_in_signature(const std::string& query,
                               const std::string& key = "SITEDECKTESTKEY0123456789ABCDEFG");

class StandInProcess {
 public:
  StandInProcess(const StandInProcess&) = delete;
  StandInProcess& operator=(const StandInProcess&) = delete;
  // Sends SIGTERM, waits up to 10 s for the exit, then SIGKILL; always reaps.
  ~StandInProcess();

  // False when the binary could not be started or announced no port in 10 s.
  bool ok() const { return port_ > 0; }
  pid_t pid() const { return pid_; }
  std::string root_url() const;  // "http://127.0.0.1:PORT"

  // Applies settings through /_control/set (values are URL-escaped here).
  // True when the server accepted all of them.
  bool control(const std::vector<std::pair<std::string, std::string>>& settings) const;
  // Back to the start-up settings and catalogue, counters zeroed, stalls released.
  bool reset() const;
  // Ends every stalled body and pending delay now.
  bool release() const;
  // The counters of /_control/stats by name; empty when unreachable.
  std::map<std::string, std::string> stats() const;

 protected:
  StandInProcess(const char* binary, const std::vector<std::string>& args);

 private:
  pid_t pid_ = -1;
  int port_ = 0;
};

// sitedeck-content-server with the sample catalogue (or `args`, e.g. {"--items", "500"}).
class ContentServerProcess : public StandInProcess {
 public:
  explicit ContentServerProcess(const std::vector<std::string>& args = {});
  // "http://127.0.0.1:PORT/SiteDeck/getSubRegionalItems"
  std::string base_url() const;
  // base_url() + "?" + query + "&hash=" + signature of query: what the service sends.
  std::string signed_url(const std::string& query) const;
  // "http://127.0.0.1:PORT/icons/" + file
  std::string icon_url(const std::string& file) const;
};

class GeocoderProcess : public StandInProcess {
 public:
  explicit GeocoderProcess(const std::vector<std::string>& args = {});
};
