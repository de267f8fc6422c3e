#include <gtest/gtest.h>

#include <cstring>

#include "pull/sitedeck-service-request-server.h"

TEST(ItemList, AppendsInCallOrderAndFreesEverything) {
  sds_item* first = sds_allocate_item_memory();
  sds_item* second = sds_allocate_item_memory();
  sds_item* third = sds_allocate_item_memory();
  ASSERT_NE(first, nullptr);
  EXPECT_EQ(sds_item_list_head, first);
  EXPECT_EQ(first->next, second);
  EXPECT_EQ(second->next, third);
  EXPECT_EQ(sds_item_list_tail, third);
  first->site_url = strdup("https://a.example/");

  sds_icon* icon1 = sds_allocate_icon_memory(&second->ps_sds_icon_list);
  sds_icon* icon2 = sds_allocate_icon_memory(&second->ps_sds_icon_list);
  EXPECT_EQ(second->ps_sds_icon_list, icon1);
  EXPECT_EQ(icon1->next, icon2);
  icon2->icon_path = strdup("https://a.example/i.png");

  sds_free_item_list();
  EXPECT_EQ(sds_item_list_head, nullptr);
  EXPECT_EQ(sds_item_list_tail, nullptr);
  sds_free_item_list();  // an empty list only resets head and tail
}

TEST(ItemList, LongListIsFreedWithoutRecursion) {
  for (int i = 0; i < 200000; ++i) ASSERT_NE(sds_allocate_item_memory(), nullptr);
  sds_free_item_list();
  EXPECT_EQ(sds_item_list_head, nullptr);
}
