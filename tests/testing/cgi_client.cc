#include "testing/cgi_client.h"

#include <csignal>
#include <cstdlib>
#include <fcntl.h>
#include <memory>
#include <sys/wait.h>
#include <unistd.h>

#include <json/reader.h>

#include "pkgserver/server_config.h"
#include "testing/temp_root.h"

namespace {

// Writes `data` to a child's stdin. A request refused before its body is read
// closes that pipe: the rest is not wanted, and the write must fail with
// EPIPE instead of killing the test. SIGPIPE is blocked in this thread
// meanwhile, and one that came is taken off before it is unblocked.
void WriteAll(int fd, const std::string& data) {
  sigset_t pipe_signal, old;
  sigemptyset(&pipe_signal);
  sigaddset(&pipe_signal, SIGPIPE);
  pthread_sigmask(SIG_BLOCK, &pipe_signal, &old);
  for (size_t done = 0; done < data.size();) {
    ssize_t n = write(fd, data.data() + done, data.size() - done);
    if (n <= 0) break;
    done += static_cast<size_t>(n);
  }
  const timespec no_wait{};
  while (sigtimedwait(&pipe_signal, nullptr, &no_wait) == SIGPIPE) {
  }
  pthread_sigmask(SIG_SETMASK, &old, nullptr);
}

std::string ReadAll(int fd) {
  std::string out;
  char buf[65536];
  for (ssize_t n; (n = read(fd, buf, sizeof(buf))) > 0;) out.append(buf, static_cast<size_t>(n));
  return out;
}

Json::Value ParseJson(const std::string& text) {
  Json::CharReaderBuilder builder;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  Json::Value value;
  if (!reader->parse(text.data(), text.data() + text.size(), &value, nullptr)) return Json::Value();
  return value;
}

}  // namespace

CgiAnswer RunEntryCgi(const CgiEnv& env, const std::string& body) {
  std::vector<std::string> vars = {"PATH=/usr/bin:/bin"};
  if (const char* root = getenv("KIVO_ROOT")) vars.push_back(std::string("KIVO_ROOT=") + root);
  for (const auto& e : env) vars.push_back(e.first + "=" + e.second);
  std::vector<char*> envp;
  for (std::string& v : vars) envp.push_back(&v[0]);
  envp.push_back(nullptr);
  std::string program = BuildDir() + "/bin/entry.cgi";

  int in[2], out[2];
  if (pipe2(in, O_CLOEXEC) != 0 || pipe2(out, O_CLOEXEC) != 0) abort();
  pid_t pid = fork();
  if (pid == 0) {
    dup2(in[0], STDIN_FILENO);
    dup2(out[1], STDOUT_FILENO);
    char* argv[] = {&program[0], nullptr};
    execve(program.c_str(), argv, envp.data());
    _exit(127);
  }
  close(in[0]);
  close(out[1]);
  WriteAll(in[1], body);
  close(in[1]);
  std::string raw = ReadAll(out[0]);
  close(out[0]);
  int status = 0;
  waitpid(pid, &status, 0);

  CgiAnswer answer;
  answer.exit_status = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
  size_t split = raw.find("\r\n\r\n");
  answer.head = raw.substr(0, split);
  answer.body = split == std::string::npos ? "" : raw.substr(split + 4);
  answer.json = ParseJson(answer.body);
  return answer;
}

std::string EncodeForm(const Params& params) {
  std::string out;
  for (const auto& p : params) {
    if (!out.empty()) out += '&';
    out += PMSUrlEncode(p.first) + "=" + PMSUrlEncode(p.second);
  }
  return out;
}

ApiClient::ApiClient(const std::string& account, const std::string& password) {
  std::string body = EncodeForm({{"api", "KIVO.API.Auth"},
                                 {"method", "login"},
                                 {"version", "1"},
                                 {"account", account},
                                 {"passwd", password}});
  CgiAnswer a = RunEntryCgi({{"REQUEST_METHOD", "POST"},
                             {"CONTENT_TYPE", "application/x-www-form-urlencoded"},
                             {"CONTENT_LENGTH", std::to_string(body.size())}},
                            body);
  if (!a.Success()) return;
  sid_ = a.Data()["sid"].asString();
  token_ = a.Data()["token"].asString();
}

CgiAnswer ApiClient::Call(const std::string& api, const std::string& method, int version,
                          const Params& params) const {
  Params all = {{"api", api}, {"method", method}, {"version", std::to_string(version)}};
  all.insert(all.end(), params.begin(), params.end());
  std::string body = EncodeForm(all);
  return RunEntryCgi({{"REQUEST_METHOD", "POST"},
                      {"CONTENT_TYPE", "application/x-www-form-urlencoded"},
                      {"CONTENT_LENGTH", std::to_string(body.size())},
                      {"HTTP_COOKIE", "id=" + sid_},
                      {"HTTP_X_KIVO_TOKEN", token_},
                      {"HTTP_HOST", "nas.example:5000"}},
                     body);
}

std::string MultipartBody(const Params& fields, const std::string& file_name,
                          const std::string& content, std::string* content_type,
                          const std::string& part) {
  const std::string boundary = "----kivo-test-boundary-7d1f";
  *content_type = "multipart/form-data; boundary=" + boundary;
  std::string body;
  for (const auto& f : fields) {
    body += "--" + boundary + "\r\nContent-Disposition: form-data; name=\"" + f.first +
            "\"\r\n\r\n" + f.second + "\r\n";
  }
  body += "--" + boundary + "\r\nContent-Disposition: form-data; name=\"" + part +
          "\"; filename=\"" + file_name + "\"\r\nContent-Type: application/octet-stream\r\n\r\n" +
          content + "\r\n--" + boundary + "--\r\n";
  return body;
}

CgiAnswer ApiClient::Upload(const std::string& api, const std::string& method, int version,
                            const Params& fields, const std::string& path) const {
  std::string content, content_type;
  FILE* f = fopen(path.c_str(), "rb");
  char buf[65536];
  for (size_t n; f && (n = fread(buf, 1, sizeof(buf), f)) > 0;) content.append(buf, n);
  if (f) fclose(f);
  return PostFilePart(api, method, version, "file", path.substr(path.rfind('/') + 1), content,
                      fields);
}

CgiAnswer ApiClient::PostFilePart(const std::string& api, const std::string& method, int version,
                                  const std::string& part, const std::string& file_name,
                                  const std::string& content, const Params& fields) const {
  std::string content_type;
  std::string body = MultipartBody(fields, file_name, content, &content_type, part);
  return RunEntryCgi(
      {{"REQUEST_METHOD", "POST"},
       {"QUERY_STRING",
        EncodeForm({{"api", api}, {"method", method}, {"version", std::to_string(version)}})},
       {"CONTENT_TYPE", content_type},
       {"CONTENT_LENGTH", std::to_string(body.size())},
       {"HTTP_COOKIE", "id=" + sid_},
       {"HTTP_X_KIVO_TOKEN", token_},
       {"HTTP_HOST", "nas.example:5000"}},
      body);
}
