// sitedeck-geocoder: a local stand-in for the reverse-geocoding web service,
// for tests and the demo. It answers GET /6.2/reversegeocode.xml?prox=LAT,LON
// &mode=retrieveAddresses&app_id=..&app_code=..&gen=1 with a "Search"
// document for a few fixed positions (matched by the exact "%f,%f" text),
// checks the credentials, and can be told to fail. Usage is in
// docs/stand-in-servers.md.
#include <cstdio>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "stand-in-server.h"

namespace {

constexpr const char* kTool = "sitedeck-geocoder";

struct geo_address {
  const char* label;
  const char* county;  // CountyName, or nullptr
  const char* state;   // StateName, or nullptr
};

struct geo_place {
  const char* prox;
  std::vector<geo_address> addresses;  // one Result each, in document order
};

// The -25.7479 entry has two results whose CountyName differ: the last one
// in document order ("Pretoria") is the one a reader must keep.
const std::vector<geo_place>& places() {
  static const std::vector<geo_place> kPlaces = {
      {"37.500000,127.000000", {{"Gangnam-gu, Seoul", "Gangnam-gu", "Seoul"}}},
      {"-26.204100,28.047300", {{"Johannesburg, Gauteng", "Johannesburg", "Gauteng"}}},
      {"-25.747900,28.229300",
       {{"Tshwane, Gauteng", "Tshwane", "Gauteng"}, {"Pretoria, Gauteng", "Pretoria", "Gauteng"}}},
      {"51.507400,-0.127800", {{"Westminster", nullptr, "England"}}},
      // Names with spaces and with a letter beyond ASCII, as real places have.
      {"-33.924900,18.424100",
       {{"City of Cape Town, Western Cape", "City of Cape Town", "Western Cape"}}},
      {"-23.550500,-46.633300", {{"S\u00e3o Paulo", "S\u00e3o Paulo", "S\u00e3o Paulo"}}},
  };
  return kPlaces;
}

struct geo_settings {
  std::string app_id = "Vb7Qm2Lx9Tr4Kp6Ws1Nd";
  std::string app_code = "Hk3Pz8Rt_Wm5Yc2Nq7Lv4J";
  int status = 200;
  bool error_root = false;
  bool namespaced = false;
  long delay_ms = 0;
  long times = 0;  // status / error_root serve this many requests; 0 = all
};

struct geo_server {
  std::mutex mutex;
  geo_settings initial;
  geo_settings settings;
  long requests = 0;
  std::string last_query;
  std::string last_user_agent;
};

std::string search_document(const std::string& prox, bool namespaced) {
  std::string xml = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n";
  xml += namespaced ? "<ns2:Search xmlns:ns2=\"urn:sitedeck:stand-in:search\">" : "<Search>";
  xml += "<Response><MetaInfo><Timestamp>2024-01-01T00:00:00.000+0000</Timestamp></MetaInfo>";
  xml += "<View><ViewId>0</ViewId>";
  for (const geo_place& place : places()) {
    if (prox != place.prox) continue;
    for (const geo_address& a : place.addresses) {
      xml += "<Result><Relevance>1.0</Relevance><MatchLevel>district</MatchLevel><Location>";
      xml += "<DisplayPosition><Latitude>" + prox.substr(0, prox.find(',')) +
             "</Latitude></DisplayPosition><Address><Label>" + std::string(a.label) + "</Label>";
      xml += "<AdditionalData key=\"CountryName\">Somewhere</AdditionalData>";
      if (a.state != nullptr) {
        xml += "<AdditionalData key=\"StateName\">" + std::string(a.state) + "</AdditionalData>";
      }
      if (a.county != nullptr) {
        xml += "<AdditionalData key=\"CountyName\">" + std::string(a.county) + "</AdditionalData>";
      }
      xml += "</Address></Location></Result>";
    }
  }
  xml += "</View></Response>";
  xml += namespaced ? "</ns2:Search>\n" : "</Search>\n";
  return xml;
}

const char* kErrorDocument =
    "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
    "<Error type=\"ApplicationError\" subtype=\"InternalError\">"
    "<Details>The service could not answer this request.</Details></Error>\n";

void consume_fault(geo_server* g) {
  std::lock_guard<std::mutex> lock(g->mutex);
  if (g->settings.times > 0 && --g->settings.times == 0) {
    g->settings.status = 200;
    g->settings.error_root = false;
  }
}

void handle_reverse_geocode(geo_server* g, const httplib::Request& req, httplib::Response& res) {
  geo_settings s;
  {
    std::lock_guard<std::mutex> lock(g->mutex);
    ++g->requests;
    g->last_query = standin_raw_query(req);
    g->last_user_agent = req.get_header_value("User-Agent");
    s = g->settings;
  }
  if (s.delay_ms > 0) (void)standin_wait_ms(s.delay_ms);
  if (s.status != 200) {
    consume_fault(g);
    res.status = s.status;
    res.set_content(kErrorDocument, "text/xml");
    return;
  }
  if (req.get_param_value("app_id") != s.app_id || req.get_param_value("app_code") != s.app_code) {
    res.status = 401;
    res.set_content(
        "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
        "<Error type=\"PermissionError\" subtype=\"InvalidCredentials\">"
        "<Details>invalid credentials</Details></Error>\n",
        "text/xml");
    return;
  }
  if (s.error_root) {
    consume_fault(g);
    res.set_content(kErrorDocument, "text/xml");
    return;
  }
  res.set_content(search_document(req.get_param_value("prox"), s.namespaced), "text/xml");
}

std::string set_locked(geo_server* g, const std::string& key, const std::string& value) {
  geo_settings& s = g->settings;
  long n = 0;
  if (key == "app_id" || key == "app_code") {
    if (value.empty()) return "expects a value";
    (key == "app_id" ? s.app_id : s.app_code) = value;
  } else if (key == "status") {
    if (!standin_parse_long(value, 100, 599, &n)) return "expects a number from 100 to 599";
    s.status = static_cast<int>(n);
  } else if (key == "error_root" || key == "namespace") {
    if (value != "0" && value != "1") return "expects 0 or 1";
    (key == "error_root" ? s.error_root : s.namespaced) = value == "1";
  } else if (key == "delay_ms") {
    if (!standin_parse_long(value, 0, 600000, &n)) return "expects a number from 0 to 600000";
    s.delay_ms = n;
  } else if (key == "times") {
    if (!standin_parse_long(value, 0, 1000000, &n)) return "expects a number from 0 to 1000000";
    s.times = n;
  } else {
    return "unknown setting";
  }
  return std::string();
}

}  // namespace

int main(int argc, char** argv) {
  auto geo = std::make_shared<geo_server>();
  auto set = [geo](const std::string& key, const std::string& value) {
    std::lock_guard<std::mutex> lock(geo->mutex);
    return set_locked(geo.get(), key, value);
  };
  standin_listen_options options;
  if (!standin_parse_args(argc, argv, &options, set)) {
    std::fprintf(stderr,
                 "usage: %s [--port N] [--port-file F] [--quiet] [--app-id ID] [--app-code CODE]\n"
                 "          [--status N] [--error-root 0|1] [--namespace 0|1] [--delay-ms N]\n",
                 kTool);
    return 2;
  }
  geo->initial = geo->settings;

  httplib::Server svr;
  standin_control control;
  control.set = set;
  control.reset = [geo] {
    std::lock_guard<std::mutex> lock(geo->mutex);
    geo->settings = geo->initial;
    geo->requests = 0;
    geo->last_query.clear();
    geo->last_user_agent.clear();
  };
  control.stats = [geo] {
    std::lock_guard<std::mutex> lock(geo->mutex);
    return "request_count: " + std::to_string(geo->requests) + "\nlast_query: " + geo->last_query +
           "\nlast_user_agent: " + geo->last_user_agent + "\n";
  };
  standin_add_control_routes(svr, std::move(control));
  svr.Get("/6.2/reversegeocode.xml", [geo](const httplib::Request& req, httplib::Response& res) {
    handle_reverse_geocode(geo.get(), req, res);
  });

  const int port = standin_bind(svr, options, kTool);
  if (port < 0) return 1;
  return standin_serve(svr, port, options, kTool);
}
