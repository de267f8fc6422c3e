#include "support/pull_rig.h"

#include <gtest/gtest.h>

#include "kdb.h"
#include "sitedeck-client-commands.h"
#include "sitedeck-service-paths.h"
#include "support/db_session.h"
#include "support/pull_env.h"

void PullRig::new_root() {
  root_.reset();
  root_ = std::make_unique<TempRoot>();
  EXPECT_TRUE(write_server_list({{1, content.base_url()}}));
  EXPECT_TRUE(kdb_write("db/browser/sitedeck/geocoder_url", geocoder.root_url().c_str()));
}

bool PullRig::open(const std::vector<std::string>& wrapper) {
  service = std::make_unique<ServiceHarness>();
  connection = SdsConnection();
  const bool started =
      wrapper.empty() ? service->start_activated() : service->start_direct_wrapped(wrapper);
  const int status = started ? service->connect(&connection, 60000) : -1;
  EXPECT_EQ(status, SDS_ERROR_NONE) << service->output();
  return status == SDS_ERROR_NONE;
}

void PullRig::close() {
  connection.close();
  int status = 0;
  ASSERT_TRUE(service->wait_exit(&status)) << service->output();
  EXPECT_EQ(exit_code_of(status), 0) << service->output();
}

int PullRig::pull_on(double latitude, double longitude, const char* version) const {
  const std::string text = version != nullptr ? version : "";
  return run_initialize(connection.fd(), connection.cid(), latitude, longitude,
                        version != nullptr ? 0 : SDS_ERROR_NO_DATA,
                        version != nullptr ? &text : nullptr)
      .final;
}

int PullRig::pull(const std::vector<std::string>& wrapper) {
  if (!open(wrapper)) return -1;
  const int status = pull_on();
  close();
  return status;
}

std::vector<std::string> PullRig::live() {
  const bool own = !connection.is_open();
  if (own && !open()) return {};
  std::vector<std::string> urls;
  sds_client_ids ids;
  if (sds_client_get_ids_by_dirty(connection, 1, &ids) == SDS_ERROR_NONE) {
    for (int32_t i = 0; i < ids.count; ++i) {
      SdsClientText url;
      if (sds_client_get_url(connection, ids.ids.get()[i], &url) != SDS_ERROR_NONE) break;
      urls.emplace_back(url.get());
    }
  }
  if (own) close();
  return urls;
}

int32_t PullRig::id_of(const std::string& url) const {
  const std::string id =
      rows_of_file(path(SDS_DB_PATH), "SELECT id FROM site_deck WHERE url = '" + url + "'");
  return id.empty() ? -1 : std::stoi(id);
}

std::string PullRig::table() const {
  return rows_of_file(path(SDS_DB_PATH),
                      "SELECT id, url, title, is_dirty, order_index, icon_size, icon_path, "
                      "image_last_updated, length(icon_data) FROM site_deck ORDER BY id");
}

std::string PullRig::file(const char* fixed) const {
  return file_exists(path(fixed)) ? read_file(path(fixed)) : "<none>";
}
