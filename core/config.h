// The master configuration: one global setting per key of the master file.
//
// A key `smtp.sock.port` fills `config.smtp_sock_port`: the field name is the
// key with every "." replaced by "_"; the message texts of the telnet proxy
// and the multi-port relay take "_msg_" for their "_" (`proxy.telnet_auth` is
// `config.proxy_telnet_msg_auth`, beside the address list `proxy_telnet_auth`).
// Other subsystems read these fields directly. config_key() works the table both ways (set from text, or give
// the current value as text), and config_save() writes the file back through
// its template.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace velmor {

// One entry of an address list, both words in network byte order. It matches
// a peer address a when (address & mask) == (a & mask).
struct AddressEntry {
  std::uint32_t address = 0;
  std::uint32_t mask = 0;
  bool operator==(const AddressEntry&) const = default;
};
// "all"/"*" is {0, 0}; "none" is {0, 0xffffffff}. An empty list matches nothing.
using AddressList = std::vector<AddressEntry>;

// A string setting: unset (never given) differs from given-but-empty.
using ConfigText = std::optional<std::string>;

// The text of a string setting, or "" when unset.
inline const std::string& text_of(const ConfigText& t) {
  static const std::string empty;
  return t ? *t : empty;
}

enum class ConfigKind { integer, string, boolean, time_of_day, address_list };

// Time of day is packed as hour * 256 + minute.
inline constexpr int time_of_day(int hour, int minute) { return (hour << 8) | minute; }

struct Config {
  bool smtp_sock_enabled = true;  // smtp.sock.enabled
  std::int32_t smtp_sock_port = 25;  // smtp.sock.port
  std::int32_t smtp_sock_timeout = 120;  // smtp.sock.timeout
  std::int32_t smtp_sock_max = 20;  // smtp.sock.max
  bool imap_sock_enabled = true;  // imap.sock.enabled
  std::int32_t imap_sock_port = 143;  // imap.sock.port
  std::int32_t imap_sock_timeout = 120;  // imap.sock.timeout
  std::int32_t imap_sock_max = 20;  // imap.sock.max
  std::int32_t imap_idle_timeout = 1740;  // imap.idle.timeout
  bool pop_sock_enabled = true;  // pop.sock.enabled
  std::int32_t pop_sock_port = 110;  // pop.sock.port
  std::int32_t pop_sock_timeout = 120;  // pop.sock.timeout
  std::int32_t pop_sock_max = 20;  // pop.sock.max
  bool proxy_ftp_sock_enabled = true;  // proxy.ftp.sock.enabled
  std::int32_t proxy_ftp_sock_port = 8021;  // proxy.ftp.sock.port
  std::int32_t proxy_ftp_sock_timeout = 120;  // proxy.ftp.sock.timeout
  std::int32_t proxy_ftp_sock_max = 20;  // proxy.ftp.sock.max
  bool proxy_http_sock_enabled = true;  // proxy.http.sock.enabled
  std::int32_t proxy_http_sock_port = 8080;  // proxy.http.sock.port
  std::int32_t proxy_http_sock_max = 20;  // proxy.http.sock.max
  bool proxy_telnet_sock_enabled = true;  // proxy.telnet.sock.enabled
  std::int32_t proxy_telnet_sock_port = 8023;  // proxy.telnet.sock.port
  std::int32_t proxy_telnet_sock_timeout = 120;  // proxy.telnet.sock.timeout
  std::int32_t proxy_telnet_sock_max = 20;  // proxy.telnet.sock.max
  bool proxy_socks_tcp_enabled = true;  // proxy.socks.tcp.enabled
  bool proxy_socks_udp_enabled = true;  // proxy.socks.udp.enabled
  std::int32_t proxy_socks_sock_port = 1080;  // proxy.socks.sock.port
  std::int32_t proxy_socks_sock_timeout = 120;  // proxy.socks.sock.timeout
  std::int32_t proxy_socks_sock_max = 20;  // proxy.socks.sock.max
  bool proxy_raudio_tcp_enabled = true;  // proxy.raudio.tcp.enabled
  bool proxy_raudio_udp_enabled = true;  // proxy.raudio.udp.enabled
  std::int32_t proxy_raudio_sock_port = 7070;  // proxy.raudio.sock.port
  std::int32_t proxy_raudio_sock_timeout = 120;  // proxy.raudio.sock.timeout
  std::int32_t proxy_raudio_sock_max = 20;  // proxy.raudio.sock.max
  bool web_sock_enabled = true;  // web.sock.enabled
  std::int32_t web_sock_port = 80;  // web.sock.port
  std::int32_t web_sock_timeout = 120;  // web.sock.timeout
  std::int32_t web_sock_max = 20;  // web.sock.max
  bool nntp_sock_enabled = true;  // nntp.sock.enabled
  std::int32_t nntp_sock_port = 119;  // nntp.sock.port
  std::int32_t nntp_sock_timeout = 120;  // nntp.sock.timeout
  std::int32_t nntp_sock_max = 20;  // nntp.sock.max
  std::int32_t proxy_icp_sock_port = 3130;  // proxy.icp.sock.port
  std::int32_t proxy_external_sock_port = 8080;  // proxy.external.sock.port
  // The TLS listeners: off unless the master file switches them on (the one
  // --init writes does).
  bool smtps_sock_enabled = false;  // smtps.sock.enabled
  std::int32_t smtps_sock_port = 465;  // smtps.sock.port
  std::int32_t smtps_sock_timeout = 120;  // smtps.sock.timeout
  std::int32_t smtps_sock_max = 20;  // smtps.sock.max
  bool submission_sock_enabled = false;  // submission.sock.enabled
  std::int32_t submission_sock_port = 587;  // submission.sock.port
  std::int32_t submission_sock_timeout = 120;  // submission.sock.timeout
  std::int32_t submission_sock_max = 20;  // submission.sock.max
  bool pops_sock_enabled = false;  // pops.sock.enabled
  std::int32_t pops_sock_port = 995;  // pops.sock.port
  std::int32_t pops_sock_timeout = 120;  // pops.sock.timeout
  std::int32_t pops_sock_max = 20;  // pops.sock.max
  bool imaps_sock_enabled = false;  // imaps.sock.enabled
  std::int32_t imaps_sock_port = 993;  // imaps.sock.port
  std::int32_t imaps_sock_timeout = 120;  // imaps.sock.timeout
  std::int32_t imaps_sock_max = 20;  // imaps.sock.max
  AddressList smtp_allow;  // smtp.allow
  AddressList smtp_auth;  // smtp.auth
  AddressList smtp_block;  // smtp.block
  AddressList pop_allow;  // pop.allow
  AddressList pop_block;  // pop.block
  AddressList imap_allow;  // imap.allow
  AddressList imap_block;  // imap.block
  AddressList proxy_ftp_allow;  // proxy.ftp.allow
  AddressList proxy_ftp_auth;  // proxy.ftp.auth
  AddressList proxy_ftp_block;  // proxy.ftp.block
  AddressList proxy_web_allow;  // proxy.web.allow
  AddressList proxy_web_auth;  // proxy.web.auth
  AddressList proxy_web_block;  // proxy.web.block
  AddressList proxy_telnet_allow;  // proxy.telnet.allow
  AddressList proxy_telnet_auth;  // proxy.telnet.auth
  AddressList proxy_telnet_block;  // proxy.telnet.block
  AddressList proxy_socks_allow;  // proxy.socks.allow
  AddressList proxy_socks_auth;  // proxy.socks.auth
  AddressList proxy_socks_block;  // proxy.socks.block
  AddressList proxy_raudio_allow;  // proxy.raudio.allow
  AddressList proxy_raudio_block;  // proxy.raudio.block
  AddressList nntp_allow;  // nntp.allow
  AddressList nntp_auth;  // nntp.auth
  AddressList nntp_block;  // nntp.block
  AddressList web_allow;  // web.allow
  AddressList web_auth;  // web.auth
  AddressList web_block;  // web.block
  AddressList dns_allow;  // dns.allow
  AddressList dns_block;  // dns.block
  AddressList util_allow;  // util.allow
  AddressList util_block;  // util.block
  ConfigText file_user_dbase;  // file.user.dbase
  ConfigText file_user_groups;  // file.user.groups
  ConfigText file_user_changes;  // file.user.changes
  ConfigText file_user_exec;  // file.user.exec
  ConfigText file_log_master;  // file.log.master
  ConfigText file_mimetypes;  // file.mimetypes
  ConfigText file_schedule;  // file.schedule
  ConfigText mail_file_alias;  // mail.file.alias
  ConfigText mail_file_smtpreject;  // mail.file.smtpreject
  ConfigText proxy_cache_index;  // proxy.cache.index
  ConfigText proxy_cache_request;  // proxy.cache.request
  ConfigText proxy_cache_peers;  // proxy.cache.peers
  ConfigText news_file_active;  // news.file.active
  ConfigText news_file_articles;  // news.file.articles
  ConfigText news_file_clients;  // news.file.clients
  ConfigText news_file_groups;  // news.file.groups
  ConfigText news_file_spools;  // news.file.spools
  ConfigText news_file_content;  // news.file.content
  ConfigText news_file_help;  // news.file.help
  ConfigText dialin_file;  // dialin.file
  ConfigText news_file_new;  // news.file.new
  ConfigText dns_file_domains;  // dns.file.domains
  ConfigText dns_file_hosts;  // dns.file.hosts
  ConfigText mail_dir_incoming;  // mail.dir.incoming
  ConfigText mail_dir_outgoing;  // mail.dir.outgoing
  ConfigText mail_dir_oddments;  // mail.dir.oddments
  ConfigText proxy_cache_dir;  // proxy.cache.dir
  ConfigText news_dir_incoming;  // news.dir.incoming
  ConfigText news_dir_outgoing;  // news.dir.outgoing
  ConfigText web_dir;  // web.dir
  ConfigText proxy_error_path;  // proxy.error.path
  ConfigText web_error_path;  // web.error.path
  ConfigText pop_hosts;  // pop.hosts
  ConfigText pop_headers;  // pop.headers
  std::int32_t pop_time = 0;  // pop.time
  ConfigText smtp_hosts;  // smtp.hosts
  ConfigText smtp_direct;  // smtp.direct
  std::int32_t smtp_time = 0;  // smtp.time
  ConfigText mail_domains;  // mail.domains
  std::int32_t mail_debatch_time = 0;  // mail.debatch.time
  std::int32_t mail_auto_send = 0;  // mail.auto.send
  ConfigText mail_from_force;  // mail.from.force
  ConfigText proxy_external;  // proxy.external
  ConfigText proxy_multiport_hosts;  // proxy.multiport.hosts
  ConfigText proxy_www_hook;  // proxy.www.hook
  ConfigText proxy_cache_exclude;  // proxy.cache.exclude
  ConfigText proxy_cache_title_format;  // proxy.cache.title.format
  ConfigText proxy_headers_remove;  // proxy.headers.remove
  ConfigText proxy_headers_add;  // proxy.headers.add
  ConfigText proxy_content_filter;  // proxy.content_filter
  ConfigText proxy_headers_log;  // proxy.headers.log
  std::int32_t proxy_cache_index_save = 0;  // proxy.cache.index.save
  std::int32_t proxy_cache_strict = 0;  // proxy.cache.strict
  std::int32_t proxy_cache_size = 0;  // proxy.cache.size
  std::int32_t proxy_cache_file_size = 0;  // proxy.cache.file.size
  std::int32_t proxy_cache_expiry_time = 0;  // proxy.cache.expiry.time
  std::int32_t proxy_cache_expiry_images = 0;  // proxy.cache.expiry.images
  std::int32_t proxy_cache_expiry_html = 0;  // proxy.cache.expiry.html
  std::int32_t proxy_cache_expiry_misc = 0;  // proxy.cache.expiry.misc
  std::int32_t proxy_cache_request_max = 0;  // proxy.cache.request.max
  std::int32_t proxy_cache_request_maxrun = 0;  // proxy.cache.request.maxrun
  std::int32_t proxy_cache_request_retries = 0;  // proxy.cache.request.retries
  std::int32_t proxy_cache_request_start = 0;  // proxy.cache.request.start
  std::int32_t proxy_cache_request_end = 0;  // proxy.cache.request.end
  bool proxy_add_via = false;  // proxy.add.via
  ConfigText proxy_telnet_msg_gethost;  // proxy.telnet_gethost
  ConfigText proxy_telnet_msg_nonet;  // proxy.telnet_nonet
  ConfigText proxy_telnet_msg_err;  // proxy.telnet_err
  ConfigText proxy_telnet_msg_unknown;  // proxy.telnet_unknown
  ConfigText proxy_telnet_msg_connect;  // proxy.telnet_connect
  ConfigText proxy_telnet_msg_connected;  // proxy.telnet_connected
  ConfigText proxy_telnet_msg_connect_opt;  // proxy.telnet_connect_opt
  ConfigText proxy_telnet_msg_deny;  // proxy.telnet_deny
  ConfigText proxy_telnet_msg_auth;  // proxy.telnet_auth
  ConfigText proxy_telnet_msg_login;  // proxy.telnet_login
  ConfigText proxy_telnet_msg_passwd;  // proxy.telnet_passwd
  ConfigText proxy_telnet_msg_badpasswd;  // proxy.telnet_badpasswd
  ConfigText proxy_multiport_msg_welcome;  // proxy.multiport_welcome
  ConfigText proxy_multiport_msg_login;  // proxy.multiport_login
  ConfigText proxy_multiport_msg_connect;  // proxy.multiport_connect
  std::int32_t news_article_list_time = 0;  // news.article.list.time
  std::int32_t news_article_hash = 0;  // news.article.hash
  std::int32_t news_active_hash = 0;  // news.active.hash
  std::int32_t news_debatch_call = 0;  // news.debatch.call
  std::int32_t news_debatch_batch = 0;  // news.debatch.batch
  std::int32_t news_client_batch = 0;  // news.client.batch
  std::int32_t news_client_batch_size = 0;  // news.client.batch.size
  std::int32_t news_article_list_size = 0;  // news.article.list.size
  std::int32_t news_overview_cache_size = 0;  // news.overview.cache.size
  bool news_active_build = false;  // news.active.build
  bool news_debatch_online = false;  // news.debatch.online
  bool news_allow_newnews = false;  // news.allow.newnews
  ConfigText news_header_post_remove;  // news.header.post.remove
  ConfigText news_header_post_add;  // news.header.post.add
  ConfigText dns_servers;  // dns.servers
  std::int32_t dns_timeout = 0;  // dns.timeout
  std::int32_t dns_retries = 0;  // dns.retries
  ConfigText dns_search;  // dns.search
  std::int32_t dialler_port = 0;  // dialler.port
  std::int32_t dialler_timeout = 0;  // dialler.timeout
  std::int32_t dialler_retries = 0;  // dialler.retries
  std::int32_t dialler_linktime = 60;  // dialler.linktime
  std::int32_t dialler_dialtime = 30;  // dialler.dialtime
  std::int32_t dialler_retrytime = 5;  // dialler.retrytime
  ConfigText dialler_driver;  // dialler.driver
  ConfigText dialler_script;  // dialler.script
  ConfigText dialler_user;  // dialler.user
  ConfigText dialler_pass;  // dialler.pass
  ConfigText dialler_phone;  // dialler.phone
  ConfigText dialler_init;  // dialler.init
  ConfigText dialler_cmd;  // dialler.cmd
  ConfigText dialler_discmd;  // dialler.discmd
  ConfigText dialler_provider;  // dialler.provider
  ConfigText dialin_addr;  // dialin.addr
  bool util_ftp_enable = false;  // util.ftp.enable
  bool util_dns_enable = false;  // util.dns.enable
  bool util_bootp_enable = false;  // util.bootp.enable
  bool util_tftp_enable = false;  // util.tftp.enable
  bool util_finger_enable = false;  // util.finger.enable
  bool util_auth_enable = false;  // util.auth.enable
  bool util_daytime_enable = false;  // util.daytime.enable
  bool util_time_enable = false;  // util.time.enable
  bool util_ntp_enable = false;  // util.ntp.enable
  bool util_telnet_enable = false;  // util.telnet.enable
  bool util_echo_enable = false;  // util.echo.enable
  bool util_discard_enable = false;  // util.discard.enable
  bool util_chargen_enable = false;  // util.chargen.enable
  bool util_ftp_ext = false;  // util.ftp.ext
  bool util_ftp_lock = false;  // util.ftp.lock
  std::int32_t util_timeout = 0;  // util.timeout
  ConfigText util_ftp_dir;  // util.ftp.dir
  ConfigText util_ftp_welcome;  // util.ftp.welcome
  ConfigText util_time_server;  // util.time.server
  ConfigText util_bootp_config;  // util.bootp.config
  ConfigText util_bootp_options;  // util.bootp.options
  ConfigText util_bootp_lease;  // util.bootp.lease
  ConfigText util_tftp_dir;  // util.tftp.dir
  ConfigText util_auth_response;  // util.auth.response
  ConfigText util_bootp_addr;  // util.bootp.addr
  ConfigText admin_email;  // admin.email
  ConfigText server_name;  // server.name
  ConfigText server_user;  // server.user: started as root, run as this user once bound
  ConfigText tls_cert;  // tls.cert: the server's certificate and its chain (PEM)
  ConfigText tls_key;  // tls.key: its private key (PEM)
  bool tls_plain_login = true;  // tls.plain.login: passwords in the clear from outside the local networks
  std::int32_t sock_buffer = 0;  // sock.buffer
  std::int32_t sock_session_max = 3600;  // sock.session.max: seconds a connection may last (0 = no limit)
  std::int32_t cache_big = 0;  // cache.big (kilobytes in the file)
  std::int32_t cache_max = 0;  // cache.max (kilobytes in the file)
  std::int32_t store_state = 1;  // store.state
  ConfigText log_format;  // log.format
  std::int32_t poll_time = 5;  // poll.time
  std::int32_t low_disc = 5;  // low.disc
  std::int32_t low_mem = 512;  // low.mem
  std::int32_t con_data_size = 15;  // con.data.size
  std::int32_t con_data_set = 0;  // con.data.set
  std::int32_t con_con_size = 15;  // con.con.size
  std::int32_t con_con_set = 0;  // con.con.set
  std::int32_t log_state = 1;  // log.state
  std::int32_t log_buffer = 8192;  // log.buffer
  std::int32_t fetch_buffer = 8192;  // fetch.buffer
  bool wimp_lock = false;  // wimp.lock
};
extern Config config;

// The key table, in the order the keys are documented.
struct ConfigKeyInfo {
  const char* name;
  ConfigKind kind;
  void* value;     // points into `config`
  int multiplier;  // 1, or 1024 for the two keys given in kilobytes
};
const std::vector<ConfigKeyInfo>& config_keys();
// What reads a key (a line of the manual page); "" for a key without an entry.
std::string_view config_key_reader(std::string_view key);

// Reads the master file (paths.master()) and applies every key in it. Keys
// missing from the file keep their current value. 0 = loaded; 1 = the file
// cannot be opened (after "Couldn't open config file:%s\n" on stdout).
int config_load();
int config_load_file(const std::string& path);
// What config_load_file does with the file's text: applies every key in it.
void config_parse(std::string_view text);

// Sets a key from its text form. Unknown keys are ignored. Returns 0.
int config_key(std::string_view key, std::string_view value);
// The current value of a key in its written-back form; nullopt for an unknown
// key or a string key that was never set.
std::optional<std::string> config_key(std::string_view key);

// Rewrites the master file from its template (keeping the old file as
// master~). Non-zero when the template cannot be read or the write fails; the
// existing master file is then left as it was.
int config_save();
int config_save_files(const std::string& template_path, const std::string& master_path);
// The master file config_save writes for the template text: comment lines
// kept, each known key given its current value.
std::string config_text(std::string_view template_text);

// Resets every setting to its built-in default (used by tests and --init).
void config_reset();

bool address_list_match(const AddressList& list, std::uint32_t address_nbo);
AddressList address_list_parse(std::string_view value);
std::string address_list_text(const AddressList& list);

// The second boolean syntax (group option flags): empty gives 1, "n..." or
// "of..." gives 0, anything else 1.
int yes_no_word(std::string_view text);

// The socket buffer size actually used: sock.buffer, never below 1024.
int socket_buffer_size();

// The site's primary mail domain: the first entry of mail.domains (at most
// 120 characters), or server.name when mail.domains is unset or empty.
std::string primary_mail_domain();
// The administrator's address as greetings and error mails name it:
// admin.email, completed with the mail domain (the first of mail.domains,
// else server.name) when it has no "@". Worked out at every use, so a
// reload of the configuration never loses the domain.
std::string admin_address();

}  // namespace velmor
