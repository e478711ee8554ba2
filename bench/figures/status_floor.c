/* The floor of "zeparelayctl status": a minimal C program that reads the same
 * files (status, relay configuration for the alias name, alias status), probes
 * the daemon with kill(pid, 0) and prints the same four lines. No JSON
 * library: plain searches, enough for the files the daemon writes. */
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/types.h>

static char* slurp(const char* root, const char* rel, char* buf, size_t size) {
    char path[4096];
    snprintf(path, sizeof(path), "%s%s", root, rel);
    FILE* f = fopen(path, "r");
    if (f == NULL) return NULL;
    size_t n = fread(buf, 1, size - 1, f);
    fclose(f);
    buf[n] = '\0';
    return buf;
}

/* The string value of "key" after start, copied into out. */
static void str_value(const char* text, const char* key, char* out, size_t size) {
    out[0] = '\0';
    const char* p = text ? strstr(text, key) : NULL;
    if (p == NULL || (p = strchr(p + strlen(key), ':')) == NULL || (p = strchr(p, '"')) == NULL) return;
    const char* e = strchr(++p, '"');
    if (e == NULL) return;
    size_t n = (size_t)(e - p) < size - 1 ? (size_t)(e - p) : size - 1;
    memcpy(out, p, n);
    out[n] = '\0';
}

static long int_value(const char* text, const char* key, long fallback) {
    const char* p = text ? strstr(text, key) : NULL;
    if (p == NULL || (p = strchr(p + strlen(key), ':')) == NULL) return fallback;
    return strtol(p + 1, NULL, 10);
}

int main(int argc, char** argv) {
    const char* root = argc > 1 ? argv[1] : "";
    static char status[65536], conf[65536], alias[65536];
    char server[256], name[256], word[256];
    const char* s = slurp(root, "/tmp/.zeparelayd.status", status, sizeof(status));
    const char* c = slurp(root, "/usr/zepa/etc/zeparelayd/zeparelayd.conf", conf, sizeof(conf));
    const char* a = slurp(root, "/tmp/hopcloud_alias.status", alias, sizeof(alias));
    long pid = int_value(s, "\"pid\"", -1);
    int running = pid > 0 && kill((pid_t)pid, 0) == 0;
    str_value(s, "\"serverID\"", server, sizeof(server));
    str_value(c, "\"alias\"", name, sizeof(name));
    str_value(a, "\"status\"", word, sizeof(word));
    printf("serverID: %s\nstate: %s\nalias: %s\nalias_status: %s\n", server,
           running && int_value(s, "\"state\"", 1) == 8 ? "connected" : "not_running", name, word);
    return running ? 0 : 1;
}
