// The mail queues. Every message that arrives is first one file of the
// incoming queue; the mail poll debatches it one file at a time into local
// mailboxes and files of the outgoing queue. Files that cannot be processed
// go to the oddments folder with their reason.
//
// Queue file: "MAIL FROM:<sender>" CR LF, one or more "RCPT TO:<address>"
// CR LF, "DATA" CR LF, then the message in SMTP transmission form (dot lines
// keep their extra dot) ending with CR LF "." CR LF. A fetched message starts
// "POP3 MAIL FROM:<".
#pragma once

#include <cstdint>
#include <ctime>
#include <list>
#include <optional>
#include <string>
#include <string_view>

namespace velmor {

class CacheFile;

struct OutgoingEntry {
  std::string path;
  std::string route;       // recipient domain when in smtp.direct, else "default"
  std::string sender;
  std::string recipients;  // joined by ", "
  std::time_t mtime = 0;
  std::int64_t size = 0;
  // The SMTP client connection that has taken this file (-1 none), until
  // that connection ends: no other connection sends it meanwhile, and a
  // rescan never drops it.
  int holder = -1;
};

int mail_init();   // start-up: counters, alias and reject tables, queue scans
void mail_poll();  // once per main-loop iteration
// Work in hand between the main loop's ticks (a burst being debatched, an
// overview being compacted), one short slice per call; true while more
// remains, so the loop comes back without waiting for the next tick.
bool mail_background();

// A new queue file path: the name is created exclusively, so a name that
// still holds mail is never reused.
std::string queue_new_incoming_name();
std::string queue_new_outgoing_name();
// Opens a new incoming queue file for writing (written under a hidden name,
// renamed into place by filecache_close). Empty handle on failure.
CacheFile queue_create_incoming();
void queue_add_incoming(const std::string& path);
void queue_add_outgoing(const std::string& path);
void queue_scan_incoming();
void queue_scan_outgoing();
void mail_debatch_one();
const std::list<std::string>& queue_incoming();
const std::list<OutgoingEntry>& queue_outgoing();

// The local user of an address, or nullopt when the address is not local.
std::optional<std::string> mail_local_user(std::string_view address);
// The site's primary mail domain (primary_mail_domain() in core/config.h).
std::string mail_primary_domain();
// Writes an error mail about `file` (may be empty) to `to` (or the file's
// sender) into the incoming queue. It comes from the null sender "<>" (its
// From: line names the administrator), and none goes to the null sender.
void mail_send_error(std::string_view text, std::string_view to, const std::string& file);
// The same for a message refused by size or content: only its header is
// attached, so the report itself never breaks the limit it reports.
void mail_send_refusal(std::string_view text, std::string_view to, const std::string& file);
std::string mail_message_id(std::string_view header_name = "Message-ID:");
// Moves a queue file aside to the oddments folder, logging the reason.
void mail_move_to_oddments(const std::string& path, std::string_view reason);
// The banned-phrase test of a group's mail.filter over a whole file.
bool mail_filter_match(std::string_view filter, const std::string& path);

int alias_load();
int alias_save();
int smtp_reject_load();
// The SMTP reject decision for a sender: true when refused.
bool smtp_reject_match(std::string_view sender);

}  // namespace velmor
