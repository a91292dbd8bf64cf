// femail: the relay mail helper of tarvod's mail actions. Reads a mail from standard input
// (a header block, one empty line, the message) and submits it over SMTP with libcurl to the
// relay in SMTPHOST ("host" or "host:port", port 25 by default), using STARTTLS when the
// relay offers it. The envelope sender is the address of the From header (none: the null
// sender), the recipients are the addresses of the To and Cc headers. Only the lines before
// the first empty line are headers; folded lines continue the header above them.
//
//   femail -t
//
// Exit status: 0 when the relay accepted the mail, 1 when it refused it or could not be
// reached (with the reason on standard error), 2 on a usage or input error.
#include <curl/curl.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace {

// A mail larger than this is refused rather than read into memory.
constexpr size_t kMaxMailBytes = 32 * 1024 * 1024;
constexpr long kConnectTimeoutSeconds = 30;
constexpr long kTransferTimeoutSeconds = 300;

struct Header {
  std::string name;
  std::string value;
};

bool IsBlank(char c) { return c == ' ' || c == '\t'; }

std::string_view Trimmed(std::string_view text) {
  while (!text.empty() && (IsBlank(text.front()) || text.front() == '\r')) text.remove_prefix(1);
  while (!text.empty() && (IsBlank(text.back()) || text.back() == '\r')) text.remove_suffix(1);
  return text;
}

// The header lines before the first empty line, with folded lines joined to the header
// they continue.
std::vector<Header> ParseHeaders(std::string_view mail) {
  std::vector<Header> headers;
  while (!mail.empty()) {
    const size_t end = mail.find('\n');
    std::string_view line = mail.substr(0, end);
    mail = end == std::string_view::npos ? std::string_view() : mail.substr(end + 1);
    if (!line.empty() && line.back() == '\r') line.remove_suffix(1);
    if (line.empty()) break;
    if (IsBlank(line.front())) {
      if (!headers.empty()) headers.back().value += " " + std::string(Trimmed(line));
      continue;
    }
    const size_t colon = line.find(':');
    if (colon == std::string_view::npos) continue;
    headers.push_back({std::string(Trimmed(line.substr(0, colon))),
                       std::string(Trimmed(line.substr(colon + 1)))});
  }
  return headers;
}

bool SameName(std::string_view a, std::string_view b) {
  return a.size() == b.size() && strncasecmp(a.data(), b.data(), a.size()) == 0;
}

// The addresses of a header value: items separated by commas outside quotes and angle
// brackets; of "Name <addr>" the part in the brackets.
std::vector<std::string> Addresses(std::string_view value) {
  std::vector<std::string> addresses;
  std::string item;
  bool quoted = false;
  int angle = 0;
  const auto finish = [&] {
    std::string_view text = Trimmed(item);
    const size_t open = text.rfind('<');
    if (open != std::string_view::npos) {
      const size_t close = text.find('>', open);
      text = Trimmed(text.substr(
          open + 1, close == std::string_view::npos ? std::string_view::npos : close - open - 1));
    }
    if (!text.empty()) addresses.emplace_back(text);
    item.clear();
  };
  for (const char c : value) {
    if (c == '"') quoted = !quoted;
    if (!quoted && c == '<') ++angle;
    if (!quoted && c == '>' && angle > 0) --angle;
    if (c == ',' && !quoted && angle == 0) {
      finish();
    } else {
      item += c;
    }
  }
  finish();
  return addresses;
}

// "smtp://host:port" from SMTPHOST; nothing when it holds characters no host name has.
std::optional<std::string> RelayUrl(std::string_view relay) {
  if (relay.empty() || relay.find_first_of("/@?# \t\r\n\\") != std::string_view::npos) {
    return std::nullopt;
  }
  const bool bracketed = relay.front() == '[';
  const size_t close = bracketed ? relay.find(']') : 0;
  if (bracketed && close == std::string_view::npos) return std::nullopt;
  const size_t colon = relay.find(':', close);
  std::string url = "smtp://" + std::string(relay);
  if (colon == std::string_view::npos) url += ":25";
  return url;
}

struct Upload {
  const std::string* data;
  size_t offset = 0;
};

size_t ReadUpload(char* buffer, size_t size, size_t count, void* argument) {
  auto* upload = static_cast<Upload*>(argument);
  const size_t room = size * count;
  const size_t left = upload->data->size() - upload->offset;
  const size_t length = left < room ? left : room;
  std::memcpy(buffer, upload->data->data() + upload->offset, length);
  upload->offset += length;
  return length;
}

int Fail(int status, const std::string& message) {
  std::fprintf(stderr, "femail: %s\n", message.c_str());
  return status;
}

}  // namespace

int main(int argc, char** argv) {
  for (int i = 1; i < argc; ++i) {
    if (std::strcmp(argv[i], "-t") != 0) {
      std::fprintf(stderr, "usage: femail -t < mail\n");
      return 2;
    }
  }
  const char* relay = std::getenv("SMTPHOST");
  const std::optional<std::string> url = RelayUrl(relay ? relay : "");
  if (!url)
    return Fail(2,
                std::string("SMTPHOST is not a host or host:port: '") + (relay ? relay : "") + "'");

  std::string mail;
  char buffer[65536];
  for (;;) {
    const ssize_t count = read(STDIN_FILENO, buffer, sizeof buffer);
    if (count == 0) break;
    if (count < 0) {
      if (errno == EINTR) continue;
      return Fail(2, std::string("can't read the mail: ") + std::strerror(errno));
    }
    if (mail.size() + static_cast<size_t>(count) > kMaxMailBytes) {
      return Fail(2, "the mail is larger than " + std::to_string(kMaxMailBytes) + " bytes");
    }
    mail.append(buffer, static_cast<size_t>(count));
  }

  // libcurl turns every LF into CRLF on the way out: a CRLF already there would gain a CR.
  for (size_t at = 0; (at = mail.find("\r\n", at)) != std::string::npos;) mail.erase(at, 1);

  std::string sender;
  std::vector<std::string> recipients;
  for (const Header& header : ParseHeaders(mail)) {
    if (SameName(header.name, "From")) {
      const std::vector<std::string> from = Addresses(header.value);
      if (!from.empty()) sender = from.front();
    } else if (SameName(header.name, "To") || SameName(header.name, "Cc")) {
      for (std::string& address : Addresses(header.value)) recipients.push_back(std::move(address));
    }
  }
  if (recipients.empty()) return Fail(2, "no recipients in the To and Cc headers");

  if (curl_global_init(CURL_GLOBAL_DEFAULT) != CURLE_OK) return Fail(1, "can't start libcurl");
  CURL* curl = curl_easy_init();
  if (curl == nullptr) return Fail(1, "can't start libcurl");
  curl_slist* rcpt = nullptr;
  for (const std::string& recipient : recipients) {
    rcpt = curl_slist_append(rcpt, ("<" + recipient + ">").c_str());
  }
  Upload upload{&mail};
  const std::string from = "<" + sender + ">";
  char error[CURL_ERROR_SIZE] = "";
  curl_easy_setopt(curl, CURLOPT_URL, url->c_str());
  curl_easy_setopt(curl, CURLOPT_PROTOCOLS_STR, "smtp");
  curl_easy_setopt(curl, CURLOPT_USE_SSL, static_cast<long>(CURLUSESSL_TRY));
  curl_easy_setopt(curl, CURLOPT_MAIL_FROM, from.c_str());
  curl_easy_setopt(curl, CURLOPT_MAIL_RCPT, rcpt);
  curl_easy_setopt(curl, CURLOPT_READFUNCTION, ReadUpload);
  curl_easy_setopt(curl, CURLOPT_READDATA, &upload);
  curl_easy_setopt(curl, CURLOPT_UPLOAD, 1L);
  curl_easy_setopt(curl, CURLOPT_INFILESIZE_LARGE, static_cast<curl_off_t>(mail.size()));
  // Lines end with CRLF on the wire; the message's own end dot is escaped by libcurl.
  curl_easy_setopt(curl, CURLOPT_CRLF, 1L);
  curl_easy_setopt(curl, CURLOPT_CONNECTTIMEOUT, kConnectTimeoutSeconds);
  curl_easy_setopt(curl, CURLOPT_TIMEOUT, kTransferTimeoutSeconds);
  curl_easy_setopt(curl, CURLOPT_NOSIGNAL, 1L);
  curl_easy_setopt(curl, CURLOPT_ERRORBUFFER, error);
  const CURLcode result = curl_easy_perform(curl);
  long response = 0;
  curl_easy_getinfo(curl, CURLINFO_RESPONSE_CODE, &response);
  curl_slist_free_all(rcpt);
  curl_easy_cleanup(curl);
  curl_global_cleanup();
  if (result != CURLE_OK) {
    std::string detail = *url + ": " + (error[0] ? error : curl_easy_strerror(result));
    if (response != 0) detail += " (reply " + std::to_string(response) + ")";
    return Fail(1, "the relay did not take the mail: " + detail);
  }
  return 0;
}
