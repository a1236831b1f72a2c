/* The floor of the host benchmark: the least a CGI program can do, print a
   fixed JSON answer. */
#include <stdio.h>

int main(void) {
  fputs("Content-Type: application/json; charset=utf-8\r\n\r\n"
        "{\"data\":{\"pkglog\":\"\"},\"success\":true}",
        stdout);
  return 0;
}
