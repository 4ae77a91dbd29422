// A settings service that desktops use, a peer of the stores. Prints the moments, in microseconds.
// Usage: pairwell_dconf write KEYS   (each byte read writes the next value, once so many keys are there)
//        pairwell_dconf watch        (each change)
#include <dconf.h>

#include <cstdio>
#include <cstdlib>
#include <string>

#include "bench/Clock.hpp"

namespace {

using bench::say;

constexpr char key[] = "/bench/value";

void insist(gboolean done, const char* what) {
  if (done) return;
  std::fprintf(stderr, "pairwell_dconf: cannot %s\n", what);
  std::exit(1);
}

void write(DConfClient* client, int keys) {
  DConfChangeset* changes = dconf_changeset_new();
  for (int number = 1; number < keys; ++number) {
    dconf_changeset_set(changes, ("/bench/key" + std::to_string(number)).c_str(),
                        g_variant_new_int64(number));
  }
  insist(keys < 2 || dconf_client_change_sync(client, changes, nullptr, nullptr, nullptr), "fill");
  say(0);
  for (gint64 value = 1; std::getchar() != EOF; ++value) {
    const double start = bench::now();
    insist(dconf_client_write_sync(client, key, g_variant_new_int64(value), nullptr, nullptr, nullptr),
           "write");
    say(start);
    say(bench::now());
  }
}

void watch(DConfClient* client) {
  g_signal_connect(client, "changed",
                   G_CALLBACK(+[](DConfClient*, gchar*, GStrv, gchar*, gpointer) { say(bench::now()); }),
                   nullptr);
  dconf_client_watch_sync(client, key);
  say(0);
  g_main_loop_run(g_main_loop_new(nullptr, FALSE));
}

}  // namespace

int main(int count, char** arguments) {
  DConfClient* client = dconf_client_new();
  const std::string action = count > 1 ? arguments[1] : "";
  if (action == "write" && count == 3) {
    write(client, std::stoi(arguments[2]));
  } else if (action == "watch" && count == 2) {
    watch(client);
  } else {
    std::fprintf(stderr, "usage: pairwell_dconf write KEYS | watch\n");
    return 2;
  }
}
