// The default deck: an item list in the content server's own JSON format with
// its PNG icons, installed under the data directory, that fills a database
// created empty so that the browser's first start page is not blank. It takes
// the road of a downloaded list (parse, icon choice, merge) with files in
// place of downloads, and stores no ETag and no update duration: the first
// real pull asks for the whole list and replaces the deck.
#pragma once

// Loads the default deck into the table, if one is installed. SDS_ERROR_NONE
// when its items were stored (an item whose icon file is missing or unusable
// is stored without an icon); SDS_ERROR_NO_DATA when there is no deck (not
// logged) or it holds no item; SDS_ERROR_DISK_BUSY when the merge was rolled
// back. Every failure but the first is logged. Runs on the worker thread,
// never during a pull: it uses the pull's process-wide item list.
int sds_default_deck_load(void);
