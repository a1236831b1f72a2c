// A second floor for the host benchmark: the least a C++ CGI program with
// the JSON library can do. The distance between the two floors is the cost
// of starting the C++ runtime, which every C++ web API program pays.
#include <cstdio>

#include <json/value.h>
#include <json/writer.h>

int main() {
  Json::Value answer(Json::objectValue);
  answer["success"] = true;
  answer["data"]["pkglog"] = "";
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  std::string body = Json::writeString(builder, answer);
  fputs("Content-Type: application/json; charset=utf-8\r\n\r\n", stdout);
  fputs(body.c_str(), stdout);
  return 0;
}
