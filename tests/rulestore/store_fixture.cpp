#include "store_fixture.h"

#include <syslog.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <sstream>

namespace fs = std::filesystem;

namespace storetest {

bool Rule::operator==(const Rule& o) const {
  return id == o.id && enabled == o.enabled && source == o.source && ports == o.ports &&
         protocol == o.protocol && minrate == o.minrate && maxrate == o.maxrate &&
         ipDirection == o.ipDirection;
}

std::ostream& operator<<(std::ostream& os, const Rule& r) {
  return os << "{id " << r.id << " en " << r.enabled << " src '" << r.source << "' ports "
            << (r.ports ? "'" + *r.ports + "'" : "NULL") << " proto " << r.protocol << " min "
            << r.minrate << " max " << r.maxrate << " dir " << r.ipDirection << "}";
}

Rule Enabled(int minrate, int maxrate) {
  Rule r;
  r.minrate = minrate;
  r.maxrate = maxrate;
  return r;
}

Rule Disabled(int minrate, int maxrate) {
  Rule r = Enabled(minrate, maxrate);
  r.enabled = 0;
  return r;
}

void StoreRoot::SetUp() {
  char tmpl[] = "/tmp/rulestore-test-XXXXXX";
  ASSERT_NE(mkdtemp(tmpl), nullptr);
  root_ = tmpl;
  setenv("ORVI_ROOT", root_.c_str(), 1);
  setenv("ORVI_TC_APPLY", "plan", 1);
  fs::create_directories(root_ + "/etc/tc");
  // Log lines also go to standard error, where a test can capture them.
  openlog("rulestore_test", LOG_PERROR, LOG_USER);
}

void StoreRoot::TearDown() {
  closelog();
  unsetenv("ORVI_ROOT");
  unsetenv("ORVI_TC_APPLY");
  std::error_code ec;
  fs::remove_all(root_, ec);
}

void StoreRoot::Put(const std::string& rel, const std::string& bytes) const {
  fs::create_directories(fs::path(Path(rel)).parent_path());
  std::ofstream out(Path(rel), std::ios::binary | std::ios::trunc);
  out << bytes;
  ASSERT_TRUE(out.good()) << rel;
}

std::string StoreRoot::Get(const std::string& rel) const {
  std::ifstream in(Path(rel), std::ios::binary);
  std::ostringstream text;
  text << in.rdbuf();
  return text.str();
}

std::vector<std::string> StoreRoot::List(const std::string& rel) const {
  std::vector<std::string> names;
  std::error_code ec;
  for (const auto& e : fs::directory_iterator(Path(rel), ec)) {
    names.push_back(e.path().filename());
  }
  std::sort(names.begin(), names.end());
  return names;
}

int StoreRoot::Save(const char* dir, const char* adapter, const std::vector<Rule>& rules) const {
  TcRuleFile* file = ORVIFwTcRuleOpen(dir, adapter);
  if (file == nullptr) return -100;
  TcRule* rec = nullptr;
  if (ORVIFwTcBufRuleInit(&rec) < 0) return -101;
  for (const Rule& r : rules) {
    rec->id = r.id;
    rec->enabled = r.enabled;
    std::memset(rec->source, 0, sizeof(rec->source));
    std::memcpy(rec->source, r.source.data(), std::min(r.source.size(), sizeof(rec->source)));
    if (r.ports) {
      rec->ports = static_cast<char*>(std::realloc(rec->ports, r.ports->size() + 1));
      std::memcpy(rec->ports, r.ports->c_str(), r.ports->size() + 1);
    } else {
      std::free(rec->ports);
      rec->ports = nullptr;
    }
    std::memcpy(&rec->protocol, &r.protocol, sizeof(int32_t));
    rec->minrate = r.minrate;
    rec->maxrate = r.maxrate;
    rec->ipDirection = r.ipDirection;
    ORVIFwTcRuleWrite(file, rec);
  }
  ORVIFwTcBufRulesFree(rec);
  return ORVIFwTcRuleClose(dir, file, adapter);
}

std::vector<Rule> StoreRoot::Load(const char* dir, const char* adapter, int* result) const {
  TcRuleList* list = nullptr;
  *result = ORVIFwTcRuleGetByAdapter(dir, adapter, &list);
  std::vector<Rule> rules;
  for (const TcRule* r = list ? list->rules : nullptr; r != nullptr; r = r->next) {
    Rule v;
    v.id = r->id;
    v.enabled = r->enabled;
    v.source.assign(r->source, strnlen(r->source, sizeof(r->source)));
    if (r->ports)
      v.ports = std::string(r->ports);
    else
      v.ports.reset();
    std::memcpy(&v.protocol, &r->protocol, sizeof(int32_t));
    v.minrate = r->minrate;
    v.maxrate = r->maxrate;
    v.ipDirection = r->ipDirection;
    rules.push_back(v);
  }
  if (list != nullptr) {
    EXPECT_EQ(list->count, static_cast<int>(rules.size()));
  }
  ORVIFwTcRulesFreeByAdapter(list);
  return rules;
}

}  // namespace storetest
