// The one end-to-end set-up for data pulls: a scratch root with the server
// list and the geocoder's address in it, the stand-in content server and
// geocoder, and the real service on the socket (under the activator, or
// activated directly behind a wrapper such as prlimit or setpriv), spoken to
// through the client library as the browser speaks to it.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "sitedeck-client.h"
#include "support/service_harness.h"
#include "support/stand_in_servers.h"
#include "support/temp_root.h"

// A latitude out of range: the pull skips the location step and asks for the
// global list, without city and province.
constexpr double kNoPosition = 1000.0;

class PullRig {
 public:
  PullRig() { new_root(); }
  // A fresh root pointed at the content server and the geocoder.
  void new_root();
  // Starts a service and connects (a failure is recorded); with a
  // `wrapper`, the service is activated directly behind it.
  bool open(const std::vector<std::string>& wrapper = {});
  // Closes the connection; the service must end with exit code 0.
  void close();
  // Command 1 on the open connection: the pull's final status.
  int pull_on(double latitude = kNoPosition, double longitude = 0,
              const char* version = nullptr) const;
  // A whole pull through its own service process; -1 when none started.
  int pull(const std::vector<std::string>& wrapper = {});
  // The live sites' URLs in deck order, read through the open connection
  // (through a process of its own when none is open).
  std::vector<std::string> live();
  int32_t id_of(const std::string& url) const;
  // Every row of the table as text, icon columns and pixel byte count included.
  std::string table() const;
  std::string path(const char* fixed) const { return root_->path(fixed); }
  std::string file(const char* fixed) const;

  ContentServerProcess content;
  GeocoderProcess geocoder;
  std::unique_ptr<TempRoot> root_;
  std::unique_ptr<ServiceHarness> service;
  SdsConnection connection;
};
