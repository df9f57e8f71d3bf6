#include "RouterRuleServHandler.h"

#include <syslog.h>

#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace {

// Every string list of this class is allocated with this capacity.
const int kSzListCapacity = 1024;

// A string list that is freed when it goes out of scope, so that a list is
// released on every path, also when a port bitset throws std::out_of_range.
// Functions that may grow a list take &list.p.
struct ScopedSzList {
  KLIBSZLIST *p;
  ScopedSzList() : p(KLIBCSzListAlloc(kSzListCapacity)) {}
  ~ScopedSzList() { KLIBCSzListFree(p); }
  ScopedSzList(const ScopedSzList &) = delete;
  ScopedSzList &operator=(const ScopedSzList &) = delete;
};

// The decimal value at text as strtol reads it, held to the int range: a
// value too large for a port stays too large (and so fails in the port
// maps) instead of wrapping around into a valid port.
int ReadPortNumber(const char *text) {
  long value = strtol(text, NULL, 10);
  if (value > INT_MAX) {
    return INT_MAX;
  }
  if (value < INT_MIN) {
    return INT_MIN;
  }
  return static_cast<int>(value);
}

// Reads one port item "a", "a-b" or "a-" into first and last. At most 15
// characters of the item are looked at; the values are not range-checked
// here, the port maps do that.
void ParsePortRange(const char *item, int *first, int *last) {
  char szBuf[16];
  snprintf(szBuf, sizeof(szBuf), "%s", item ? item : "");
  char *pDash = strchr(szBuf, '-');
  if (NULL == pDash) {
    *first = ReadPortNumber(szBuf);
    *last = *first;
    return;
  }
  *pDash = '\0';
  *first = ReadPortNumber(szBuf);
  if ('\0' == pDash[1]) {
    *last = *first;
  } else {
    *last = ReadPortNumber(pDash + 1);
  }
}

// Appends a port list to out, with a "," between the two when out already
// holds something.
void AppendPortList(std::string &out, const std::string &ports) {
  if (!out.empty()) {
    out += ",";
  }
  out += ports;
}

// Closes a run of free ports from s to e into out.
void AppendPortRun(std::string &out, int s, int e) {
  char szBuf[16];
  if (s == e) {
    snprintf(szBuf, sizeof(szBuf), "%d", s);
  } else {
    snprintf(szBuf, sizeof(szBuf), "%d-%d", s, e);
  }
  AppendPortList(out, szBuf);
}

// The identifier text of one element of a JSON array of service
// identifiers; an element that is not a string names no service.
std::string ServiceIdOf(const Json::Value &element) {
  return element.isString() ? element.asString() : std::string();
}

} // namespace

RouterRuleServHandler::RouterRuleServHandler() : mFwServiceTable(NULL) {
  mTCPPortMap.reset();
  mUDPPortMap.reset();
}

RouterRuleServHandler::~RouterRuleServHandler() {
  if (NULL != mFwServiceTable) {
    ZARKFwServiceFree(mFwServiceTable);
    mFwServiceTable = NULL;
  }
}

// ---------------------------------------------------------------------------
// Port maps
// ---------------------------------------------------------------------------

// std::bitset::set(pos) throws std::out_of_range ("bitset::set") for a
// position past the map, and a negative port converts to one: a range that
// runs past 65535 marks its ports up to 65535 and then fails.
void RouterRuleServHandler::FillTCPBitSet(int first, int last) {
  for (int port = first; port <= last; ++port) {
    mTCPPortMap.set(static_cast<size_t>(port));
  }
}

void RouterRuleServHandler::FillUDPBitSet(int first, int last) {
  for (int port = first; port <= last; ++port) {
    mUDPPortMap.set(static_cast<size_t>(port));
  }
}

// An empty range (first > last) counts as covered. std::bitset::test(pos)
// throws std::out_of_range ("bitset::test") for a position past the map.
bool RouterRuleServHandler::CheckTCPBitSet(int first, int last) {
  for (int port = first; port <= last; ++port) {
    if (!mTCPPortMap.test(static_cast<size_t>(port))) {
      return false;
    }
  }
  return true;
}

bool RouterRuleServHandler::CheckUDPBitSet(int first, int last) {
  for (int port = first; port <= last; ++port) {
    if (!mUDPPortMap.test(static_cast<size_t>(port))) {
      return false;
    }
  }
  return true;
}

int RouterRuleServHandler::FillPortMapByPorts(int protoMask,
                                              KLIBSZLIST *ports) {
  if (NULL == ports) {
    syslog(LOG_ERR, "%s:%d pslPorts should not be null", __FILE__, __LINE__);
    return -1;
  }
  for (int i = 0; i < ports->nItem; ++i) {
    int first = 0;
    int last = 0;
    ParsePortRange(KLIBCSzListGet(ports, i), &first, &last);
    if (protoMask & ZARK_FW_PROTO_TCP) {
      FillTCPBitSet(first, last);
    }
    if (protoMask & ZARK_FW_PROTO_UDP) {
      FillUDPBitSet(first, last);
    }
  }
  return 0;
}

int RouterRuleServHandler::FillPortMapByPorts(const std::string &tcpPorts,
                                              const std::string &udpPorts) {
  ScopedSzList tcpList;
  ScopedSzList udpList;
  if (NULL == tcpList.p || NULL == udpList.p) {
    syslog(LOG_ERR, "%s:%d KLIBCSzListAlloc Error, [0x%04X %s:%d]", __FILE__,
           __LINE__, KLIBCErrGet(), KLIBCErrorGetFile(), KLIBCErrorGetLine());
    return -1;
  }
  if (0 > KLIBCStrSep(tcpPorts.c_str(), ",", &tcpList.p)) {
    syslog(LOG_ERR, "%s:%d KLIBCStrSep failed, strPort=[%s], [0x%04X %s:%d]",
           __FILE__, __LINE__, tcpPorts.c_str(), KLIBCErrGet(),
           KLIBCErrorGetFile(), KLIBCErrorGetLine());
    return -1;
  }
  if (0 > KLIBCStrSep(udpPorts.c_str(), ",", &udpList.p)) {
    syslog(LOG_ERR, "%s:%d KLIBCStrSep failed, strPort=[%s], [0x%04X %s:%d]",
           __FILE__, __LINE__, udpPorts.c_str(), KLIBCErrGet(),
           KLIBCErrorGetFile(), KLIBCErrorGetLine());
    return -1;
  }
  FillPortMapByPorts(ZARK_FW_PROTO_TCP, tcpList.p);
  FillPortMapByPorts(ZARK_FW_PROTO_UDP, udpList.p);
  return 0;
}

// Exactly "tcp" selects the TCP map; every other text the UDP map.
// The signature (proto by value) is the class's published one.
// cppcheck-suppress passedByValue
// NOLINTNEXTLINE(performance-unnecessary-value-param)
int RouterRuleServHandler::CheckPort(std::string proto, int port) {
  const std::bitset<65536> &portMap =
      ("tcp" == proto) ? mTCPPortMap : mUDPPortMap;
  return portMap.test(static_cast<size_t>(port)) ? 1 : 0;
}

// Appends the free parts of first..last as runs: with 8082 taken,
// 8080..8085 gives "8080-8081,8083-8085".
void RouterRuleServHandler::FilterOutPorts(const std::string &proto, int first,
                                           int last, std::string &out) {
  if (first > last) {
    return;
  }
  const std::bitset<65536> &portMap =
      ("tcp" == proto) ? mTCPPortMap : mUDPPortMap;
  bool blInRun = false;
  int runStart = 0;
  for (int port = first; port <= last; ++port) {
    bool blTaken = portMap.test(static_cast<size_t>(port));
    if (!blTaken && !blInRun) {
      blInRun = true;
      runStart = port;
    } else if (blTaken && blInRun) {
      AppendPortRun(out, runStart, port - 1);
      blInRun = false;
    }
  }
  if (blInRun) {
    AppendPortRun(out, runStart, last);
  }
}

// The signature (proto by value) is the class's published one.
// cppcheck-suppress passedByValue
// NOLINTNEXTLINE(performance-unnecessary-value-param)
int RouterRuleServHandler::RemoveConflictPort(std::string proto,
                                              KLIBSZLIST *ports,
                                              std::string &out) {
  if (NULL == ports) {
    return -1;
  }
  out.clear();
  for (int i = 0; i < ports->nItem; ++i) {
    int first = 0;
    int last = 0;
    std::string strFree;
    ParsePortRange(KLIBCSzListGet(ports, i), &first, &last);
    FilterOutPorts(proto, first, last, strFree);
    if (!strFree.empty()) {
      AppendPortList(out, strFree);
    }
  }
  return 0;
}

// ---------------------------------------------------------------------------
// Services and firewall sections
// ---------------------------------------------------------------------------

int RouterRuleServHandler::FwSectionEnum() {
  // A handler enumerates once; a second call replaces the table.
  if (NULL != mFwServiceTable) {
    ZARKFwServiceFree(mFwServiceTable);
    mFwServiceTable = NULL;
  }
  if (0 < ZARKFwServiceEnum(&mFwServiceTable)) {
    return 0;
  }
  syslog(LOG_ERR, "%s:%d Failed to enum firewall section, [0x%04X %s:%d]",
         __FILE__, __LINE__, KLIBCErrGet(), KLIBCErrorGetFile(),
         KLIBCErrorGetLine());
  return -1;
}

// Sections of a package service come from its own ".sc" file and from its
// entry in the service mapping table. The entry either names another file
// of the package service folder or lists section names.
int RouterRuleServHandler::ReadPackageServiceSections(const char *serviceId,
                                                      KLIBSZLIST **sections) {
  if (NULL == serviceId || NULL == sections || NULL == *sections) {
    KLIBCErrSetEx(KLIBC_ERR_BAD_PARAMETER, __FILE__, __LINE__);
    return -1;
  }
  char szFile[1024];
  char szValue[1024];
  snprintf(szFile, sizeof(szFile), "%s/%s.sc", ZARK_FW_PACKAGE_SERVICE_DIR,
           serviceId);

  if (0 < KLIBCFileExist(szFile)) {
    if (0 > KLIBCFileEnumSection(szFile, sections)) {
      syslog(LOG_ERR,
             "%s:%d KLIBCFileEnumSection error, szFile=[%s], zarkerr=[0x%04X]",
             __FILE__, __LINE__, szFile, KLIBCErrGet());
      return -1;
    }
    int valueLen = KLIBCFileGetKeyValue(ZARK_FW_SERVICE_MAPPING_TABLE,
                                        serviceId, szValue, sizeof(szValue), 0);
    if (0 > valueLen) {
      syslog(LOG_ERR,
             "%s:%d KLIBCFileGetKeyValue error, szFile=[%s], zarkerr=[0x%04X]",
             __FILE__, __LINE__, ZARK_FW_SERVICE_MAPPING_TABLE, KLIBCErrGet());
      return -1;
    }
    if (0 < valueLen && 0 > KLIBCStrTok(szValue, ",", sections)) {
      syslog(LOG_ERR, "%s:%d KLIBCStrTok error, zarkerr=[0x%04X]", __FILE__,
             __LINE__, KLIBCErrGet());
      return -1;
    }
    return (*sections)->nItem;
  }

  int valueLen = KLIBCFileGetKeyValue(ZARK_FW_SERVICE_MAPPING_TABLE, serviceId,
                                      szValue, sizeof(szValue), 0);
  if (0 > valueLen) {
    syslog(LOG_ERR,
           "%s:%d KLIBCFileGetKeyValue error, szFile=[%s], zarkerr=[0x%04X]",
           __FILE__, __LINE__, ZARK_FW_SERVICE_MAPPING_TABLE, KLIBCErrGet());
    return -1;
  }
  if (0 < valueLen) {
    // A value too long to be a file name of the folder is a section list.
    int pathLen = snprintf(szFile, sizeof(szFile), "%s/%s",
                           ZARK_FW_PACKAGE_SERVICE_DIR, szValue);
    if (pathLen >= static_cast<int>(sizeof(szFile))) {
      szFile[0] = '\0';
    }
  }
  if (0 < KLIBCFileExist(szFile)) {
    if (0 > KLIBCFileEnumSection(szFile, sections)) {
      syslog(LOG_ERR,
             "%s:%d KLIBCFileEnumSection error, szFile=[%s], zarkerr=[0x%04X]",
             __FILE__, __LINE__, szFile, KLIBCErrGet());
      return -1;
    }
  } else if (0 < valueLen) {
    if (0 > KLIBCStrTok(szValue, ",", sections)) {
      syslog(LOG_ERR, "%s:%d KLIBCStrTok error, zarkerr=[0x%04X]", __FILE__,
             __LINE__, KLIBCErrGet());
      return -1;
    }
  }
  return (*sections)->nItem;
}

int RouterRuleServHandler::GetServiceSections(const char *serviceId,
                                              KLIBSZLIST *systemServices,
                                              KLIBSZLIST **sections) {
  if (NULL == serviceId || NULL == systemServices || NULL == sections ||
      NULL == *sections) {
    return -1;
  }
  if (0 > KLIBCSzListFind(systemServices, serviceId)) {
    // Not one of the system's own services: a package service.
    if (0 < ReadPackageServiceSections(serviceId, sections)) {
      return (*sections)->nItem;
    }
    return 0;
  }
  if (0 == KLIBServicecfgInfoGet(serviceId, KLIB_SERVICE_INFO_FW_SECTIONS,
                                 sections)) {
    return (*sections)->nItem;
  }
  return 0;
}

// Walks backwards so that removing an item keeps the indices still to be
// visited valid.
int RouterRuleServHandler::RemoveSection(KLIBSZLIST *sections) {
  if (NULL == sections) {
    return -1;
  }
  for (int i = sections->nItem - 1; i >= 0; --i) {
    const ZARK_FW_SERVICE *pService =
        ZARKFWServiceFind(mFwServiceTable, KLIBCSzListGet(sections, i));
    if (NULL == pService || 0 == pService->blUsable) {
      KLIBCSzListRemove(sections, i);
    }
  }
  return sections->nItem;
}

int RouterRuleServHandler::FillPortMapByFwSection(KLIBSZLIST *sections) {
  if (NULL == sections) {
    syslog(LOG_ERR, "%s:%d pslFwSection should not be null", __FILE__,
           __LINE__);
    return -1;
  }
  for (int i = 0; i < sections->nItem; ++i) {
    const ZARK_FW_SERVICE *pService =
        ZARKFWServiceFind(mFwServiceTable, KLIBCSzListGet(sections, i));
    if (NULL == pService) {
      continue;
    }
    if (0 > FillPortMapByPorts(pService->protoMask, pService->pslPorts)) {
      return -1;
    }
  }
  return 0;
}

int RouterRuleServHandler::FillPortMapByServ(const Json::Value &services) {
  ScopedSzList sections;
  ScopedSzList systemServices;
  if (NULL == sections.p || NULL == systemServices.p) {
    syslog(LOG_ERR, "%s:%d KLIBCSzListAlloc Error, [0x%04X %s:%d]", __FILE__,
           __LINE__, KLIBCErrGet(), KLIBCErrorGetFile(), KLIBCErrorGetLine());
    return -1;
  }
  if (0 != KLIBServiceEnum(&systemServices.p)) {
    syslog(LOG_ERR, "%s:%d Failed to enum service, [0x%04X %s:%d]", __FILE__,
           __LINE__, KLIBCErrGet(), KLIBCErrorGetFile(), KLIBCErrorGetLine());
    return -1;
  }
  // A service whose sections cannot be read simply adds no ports.
  for (Json::ArrayIndex i = 0; i < services.size(); ++i) {
    std::string strServiceId = ServiceIdOf(services[i]);
    GetServiceSections(strServiceId.c_str(), systemServices.p, &sections.p);
  }
  if (0 > RemoveSection(sections.p)) {
    return -1;
  }
  if (0 > FillPortMapByFwSection(sections.p)) {
    return -1;
  }
  return 0;
}

// ---------------------------------------------------------------------------
// Forwarding status of services
// ---------------------------------------------------------------------------

// Every failure is logged only: the caller always gets 0, with out holding
// what was appended so far.
int RouterRuleServHandler::GetServPfStatus(const Json::Value &serviceIds,
                                           Json::Value &out) {
  if (!serviceIds.isArray()) {
    syslog(LOG_ERR, "%s:%d Required parameter error!", __FILE__, __LINE__);
    return 0;
  }
  ScopedSzList ids;
  ScopedSzList systemServices;
  ScopedSzList sections;
  if (NULL == ids.p || NULL == systemServices.p || NULL == sections.p) {
    syslog(LOG_ERR, "%s:%d KLIBCSzListAlloc Error, [0x%04X %s:%d]", __FILE__,
           __LINE__, KLIBCErrGet(), KLIBCErrorGetFile(), KLIBCErrorGetLine());
    return 0;
  }
  if (0 > FwSectionEnum() || 0 > FillPortMapByPfRules()) {
    return 0;
  }
  if (0 != KLIBServiceEnum(&systemServices.p)) {
    syslog(LOG_ERR, "%s:%d Failed to enum service, [0x%04X %s:%d]", __FILE__,
           __LINE__, KLIBCErrGet(), KLIBCErrorGetFile(), KLIBCErrorGetLine());
    return 0;
  }
  if (serviceIds.empty()) {
    if (0 != KLIBServiceEnum(&ids.p)) {
      syslog(LOG_ERR, "%s:%d Failed to enum service, [0x%04X %s:%d]", __FILE__,
             __LINE__, KLIBCErrGet(), KLIBCErrorGetFile(), KLIBCErrorGetLine());
      return 0;
    }
  } else {
    for (Json::ArrayIndex i = 0; i < serviceIds.size(); ++i) {
      std::string strServiceId = ServiceIdOf(serviceIds[i]);
      KLIBCSzListPush(&ids.p, strServiceId.c_str());
    }
    KLIBCSzListSortItems(ids.p, 1);
  }

  Json::Value result(Json::objectValue);
  for (int i = 0; i < ids.p->nItem; ++i) {
    const char *szServiceId = KLIBCSzListGet(ids.p, i);
    result.clear();
    KLIBCSzListRemoveAll(sections.p);
    result["service_id"] = szServiceId;
    if (0 >= GetServiceSections(szServiceId, systemServices.p, &sections.p)) {
      result["status"] = "unknown";
    } else if (0 >= RemoveSection(sections.p)) {
      result["status"] = "unknown";
    } else {
      CheckPfRulesByFwSection(sections.p, result);
    }
    out.append(result);
  }
  return 0;
}

// Marks the local ports of every enabled rule: "tcp" rules in the TCP map,
// every other protocol text in the UDP map. Router-side ports do not count.
int RouterRuleServHandler::FillPortMapByPfRules() {
  RouterRuleConfReader reader(false);
  ScopedSzList ports;
  if (NULL == ports.p) {
    syslog(LOG_ERR, "%s:%d KLIBCSzListAlloc Error, [0x%04X %s:%d]", __FILE__,
           __LINE__, KLIBCErrGet(), KLIBCErrorGetFile(), KLIBCErrorGetLine());
    return -1;
  }
  if (!reader.StartNextRule()) {
    return 0;
  }
  do {
    bool blEnabled = false;
    std::string strRouterPorts;
    std::string strDsPorts;
    std::string strProtocol;
    std::string strServiceId;
    KLIBCSzListRemoveAll(ports.p);
    if (!reader.GetRuleInfo(blEnabled, strRouterPorts, strDsPorts, strProtocol,
                            strServiceId)) {
      syslog(LOG_ERR, "%s:%d get rule failed", __FILE__, __LINE__);
      return -1;
    }
    if (!blEnabled) {
      continue;
    }
    if (0 > KLIBCStrSep(strDsPorts.c_str(), ",", &ports.p)) {
      syslog(LOG_ERR,
             "%s:%d KLIBCStrSep failed, strDsPorts=[%s], [0x%04X %s:%d]",
             __FILE__, __LINE__, strDsPorts.c_str(), KLIBCErrGet(),
             KLIBCErrorGetFile(), KLIBCErrorGetLine());
      return -1;
    }
    FillPortMapByPorts(("tcp" == strProtocol) ? ZARK_FW_PROTO_TCP
                                              : ZARK_FW_PROTO_UDP,
                       ports.p);
  } while (reader.NextRule());
  return 0;
}

int RouterRuleServHandler::CheckPfRulesByPorts(int protoMask,
                                               KLIBSZLIST *ports) {
  if (NULL == ports) {
    return 0;
  }
  for (int i = 0; i < ports->nItem; ++i) {
    int first = 0;
    int last = 0;
    ParsePortRange(KLIBCSzListGet(ports, i), &first, &last);
    if ((protoMask & ZARK_FW_PROTO_TCP) && !CheckTCPBitSet(first, last)) {
      return 0;
    }
    if ((protoMask & ZARK_FW_PROTO_UDP) && !CheckUDPBitSet(first, last)) {
      return 0;
    }
  }
  return 1;
}

void RouterRuleServHandler::CheckPfRulesByFwSection(KLIBSZLIST *sections,
                                                    Json::Value &result) {
  if (NULL == sections || 0 == sections->nItem) {
    result["status"] = "unknown";
    return;
  }
  bool blDenied = false;
  for (int i = 0; i < sections->nItem; ++i) {
    const char *szSection = KLIBCSzListGet(sections, i);
    const ZARK_FW_SERVICE *pService =
        ZARKFWServiceFind(mFwServiceTable, szSection);
    if (NULL == pService) {
      // The section vanished: what was written so far stays.
      result["status"] = "unknown";
      return;
    }
    if (CheckPfRulesByPorts(pService->protoMask, pService->pslPorts)) {
      result["port_info"][szSection] = "allow";
    } else {
      result["port_info"][szSection] = "deny";
      blDenied = true;
    }
  }
  result["status"] = blDenied ? "deny" : "allow";
}

// ---------------------------------------------------------------------------
// Rules for services
// ---------------------------------------------------------------------------

// Services win: every port of a service being added or removed is taken out
// of the existing rules, then each added service's sections get rules of
// their own. The writer is not synced here.
int RouterRuleServHandler::SetServPfRules(const Json::Value &policy,
                                          RouterRuleConfWriter &writer) {
  if (!policy.isNull() && !policy.isObject()) {
    syslog(LOG_ERR, "%s:%d wrong parameter, policy should be object", __FILE__,
           __LINE__);
    return -1;
  }
  if ((policy.isMember("add") && !policy["add"].isArray()) ||
      (policy.isMember("remove") && !policy["remove"].isArray())) {
    syslog(LOG_ERR, "%s:%d wrong parameter, should be array", __FILE__,
           __LINE__);
    return -1;
  }
  Json::Value add = policy.isMember("add") ? policy["add"] : Json::Value();
  Json::Value remove =
      policy.isMember("remove") ? policy["remove"] : Json::Value();

  if (0 > FwSectionEnum() || 0 > FillPortMapByServ(remove) ||
      0 > FillPortMapByServ(add)) {
    return -1;
  }
  int ruleId = 0;
  if (0 > WriteOrgPfRules(writer, &ruleId)) {
    return -1;
  }
  mTCPPortMap.reset();
  mUDPPortMap.reset();
  return (0 == AddPfRuleByServ(writer, add, &ruleId)) ? 0 : -1;
}

// Copies the current rules into the writer minus the ports held in the port
// maps. A rule whose router and local ports differ can only be kept, as a
// disabled rule, when it maps one single port; anything wider cannot be cut
// consistently on both sides and fails the whole rewrite.
int RouterRuleServHandler::WriteOrgPfRules(RouterRuleConfWriter &writer,
                                           int *ruleId) {
  RouterRuleConfReader reader(false);
  ScopedSzList routerList;
  ScopedSzList localList;
  if (NULL == routerList.p || NULL == localList.p) {
    syslog(LOG_ERR, "%s:%d KLIBCSzListAlloc Error, [0x%04X %s:%d]", __FILE__,
           __LINE__, KLIBCErrGet(), KLIBCErrorGetFile(), KLIBCErrorGetLine());
    return -1;
  }
  if (!reader.StartNextRule()) {
    return 0;
  }
  do {
    bool blEnabled = false;
    std::string strRouterPorts;
    std::string strLocalPorts;
    std::string strProtocol;
    std::string strServiceId;
    KLIBCSzListRemoveAll(routerList.p);
    KLIBCSzListRemoveAll(localList.p);
    if (!reader.GetRuleInfo(blEnabled, strRouterPorts, strLocalPorts,
                            strProtocol, strServiceId)) {
      return -1;
    }
    const std::string strOrgRouterPorts = strRouterPorts;
    const std::string strOrgLocalPorts = strLocalPorts;

    if (0 > KLIBCStrSep(strOrgRouterPorts.c_str(), ",", &routerList.p)) {
      syslog(LOG_ERR,
             "%s:%d KLIBCStrSep failed, strRouterPort=[%s], [0x%04X %s:%d]",
             __FILE__, __LINE__, strOrgRouterPorts.c_str(), KLIBCErrGet(),
             KLIBCErrorGetFile(), KLIBCErrorGetLine());
      return -1;
    }
    if (0 > RemoveConflictPort(strProtocol, routerList.p, strRouterPorts)) {
      return -1;
    }
    // The local side's split failure reuses the router side's message text
    // ("strRouterPort") on purpose: one message for both splits.
    if (0 > KLIBCStrSep(strOrgLocalPorts.c_str(), ",", &localList.p)) {
      syslog(LOG_ERR,
             "%s:%d KLIBCStrSep failed, strRouterPort=[%s], [0x%04X %s:%d]",
             __FILE__, __LINE__, strOrgLocalPorts.c_str(), KLIBCErrGet(),
             KLIBCErrorGetFile(), KLIBCErrorGetLine());
      return -1;
    }
    if (0 > RemoveConflictPort(strProtocol, localList.p, strLocalPorts)) {
      return -1;
    }

    bool blAdded = false;
    if (strRouterPorts.empty() && strLocalPorts.empty()) {
      // Every port of the rule now belongs to a service.
      continue;
    } else if (strLocalPorts == strOrgLocalPorts &&
               strRouterPorts == strOrgRouterPorts) {
      blAdded = writer.AddRule(*ruleId, blEnabled, strRouterPorts,
                               strLocalPorts, strProtocol, strServiceId, "");
    } else if (strRouterPorts == strLocalPorts) {
      blAdded = writer.AddRule(*ruleId, blEnabled, strRouterPorts,
                               strLocalPorts, strProtocol, strServiceId, "");
    } else {
      if (1 < routerList.p->nItem || 1 < localList.p->nItem ||
          std::string::npos != strOrgRouterPorts.find('-') ||
          std::string::npos != strOrgLocalPorts.find('-')) {
        return -1;
      }
      blAdded = writer.AddRule(*ruleId, false, strOrgRouterPorts,
                               strOrgLocalPorts, strProtocol, strServiceId, "");
    }
    if (!blAdded) {
      syslog(LOG_ERR, "%s:%d add rule failed", __FILE__, __LINE__);
      return -1;
    }
    ++(*ruleId);
  } while (reader.NextRule());
  return 0;
}

int RouterRuleServHandler::AddPfRuleByServ(RouterRuleConfWriter &writer,
                                           const Json::Value &services,
                                           int *ruleId) {
  ScopedSzList sections;
  ScopedSzList systemServices;
  if (NULL == sections.p || NULL == systemServices.p) {
    syslog(LOG_ERR, "%s:%d KLIBCSzListAlloc Error, [0x%04X %s:%d]", __FILE__,
           __LINE__, KLIBCErrGet(), KLIBCErrorGetFile(), KLIBCErrorGetLine());
    return -1;
  }
  if (0 > KLIBServiceEnum(&systemServices.p)) {
    syslog(LOG_ERR, "%s:%d Failed to enum service, [0x%04X %s:%d]", __FILE__,
           __LINE__, KLIBCErrGet(), KLIBCErrorGetFile(), KLIBCErrorGetLine());
    return -1;
  }
  for (Json::ArrayIndex i = 0; i < services.size(); ++i) {
    std::string strServiceId = ServiceIdOf(services[i]);
    GetServiceSections(strServiceId.c_str(), systemServices.p, &sections.p);
  }
  if (0 > RemoveSection(sections.p)) {
    return -1;
  }
  if (0 > AddPfRuleByFwSction(writer, sections.p, ruleId)) {
    return -1;
  }
  return 0;
}

// One rule per section and protocol, for the ports still free; what a
// section gets is then marked taken, so a later section (or a section named
// twice) that shares ports only gets the rest. Router and local ports are
// equal, and the section name stands in the rule's service field.
int RouterRuleServHandler::AddPfRuleByFwSction(RouterRuleConfWriter &writer,
                                               KLIBSZLIST *sections,
                                               int *ruleId) {
  if (NULL == sections || NULL == ruleId) {
    syslog(LOG_ERR, "%s:%d pslFwSection should not be null", __FILE__,
           __LINE__);
    return -1;
  }
  for (int i = 0; i < sections->nItem; ++i) {
    const char *szSection = KLIBCSzListGet(sections, i);
    std::string strTcpFree;
    std::string strUdpFree;
    const ZARK_FW_SERVICE *pService =
        ZARKFWServiceFind(mFwServiceTable, szSection);
    if (NULL == pService) {
      continue;
    }
    if (pService->protoMask & ZARK_FW_PROTO_TCP) {
      if (0 > RemoveConflictPort("tcp", pService->pslPorts, strTcpFree)) {
        return -1;
      }
      if (!strTcpFree.empty()) {
        if (!writer.AddRule(*ruleId, true, strTcpFree, strTcpFree, "tcp",
                            szSection, "")) {
          return -1;
        }
        ++(*ruleId);
      }
    }
    if (pService->protoMask & ZARK_FW_PROTO_UDP) {
      if (0 > RemoveConflictPort("udp", pService->pslPorts, strUdpFree)) {
        return -1;
      }
      if (!strUdpFree.empty()) {
        if (!writer.AddRule(*ruleId, true, strUdpFree, strUdpFree, "udp",
                            szSection, "")) {
          return -1;
        }
        ++(*ruleId);
      }
    }
    if (0 > FillPortMapByPorts(strTcpFree, strUdpFree)) {
      return -1;
    }
  }
  return 0;
}

// Writes the rules that the connection test of services uses, into the
// test rule configuration. A single identifier string is one service.
int RouterRuleServHandler::SetServPfTestRules(const Json::Value &services) {
  if (!services.isArray() && !services.isString()) {
    syslog(LOG_ERR, "%s:%d wrong parameter, should be array or string",
           __FILE__, __LINE__);
    return -1;
  }
  Json::Value serviceList(Json::arrayValue);
  if (services.isString()) {
    serviceList.append(services);
  } else {
    serviceList = services;
  }
  RouterRuleConfWriter writer;
  if (0 > FwSectionEnum()) {
    return -1;
  }
  if (0 > AddPfRuleByServ(writer, serviceList)) {
    return -1;
  }
  return writer.Sync(ZARK_PORTMAP_TEST_RULE_CONF) ? 0 : -1;
}

int RouterRuleServHandler::AddPfRuleByServ(RouterRuleConfWriter &writer,
                                           const Json::Value &services) {
  ScopedSzList sections;
  ScopedSzList systemServices;
  if (NULL == sections.p || NULL == systemServices.p) {
    syslog(LOG_ERR, "%s:%d KLIBCSzListAlloc Error, [0x%04X %s:%d]", __FILE__,
           __LINE__, KLIBCErrGet(), KLIBCErrorGetFile(), KLIBCErrorGetLine());
    return -1;
  }
  if (0 > KLIBServiceEnum(&systemServices.p)) {
    syslog(LOG_ERR, "%s:%d Failed to enum service, [0x%04X %s:%d]", __FILE__,
           __LINE__, KLIBCErrGet(), KLIBCErrorGetFile(), KLIBCErrorGetLine());
    return -1;
  }
  for (Json::ArrayIndex i = 0; i < services.size(); ++i) {
    std::string strServiceId = ServiceIdOf(services[i]);
    KLIBCSzListRemoveAll(sections.p);
    GetServiceSections(strServiceId.c_str(), systemServices.p, &sections.p);
    if (0 > RemoveSection(sections.p)) {
      return -1;
    }
    if (0 > AddPfRuleByFwSction(strServiceId.c_str(), sections.p, writer)) {
      return -1;
    }
  }
  return 0;
}

// One pair of rules per service, "<id>.tcp" and "<id>.udp", holding every
// port of its sections, without conflict removal. A section unknown to the
// firewall makes the service write nothing at all.
int RouterRuleServHandler::AddPfRuleByFwSction(const char *serviceId,
                                               KLIBSZLIST *sections,
                                               RouterRuleConfWriter &writer) {
  if (NULL == serviceId || NULL == sections) {
    syslog(LOG_ERR, "%s:%d pslFwSection should not be null", __FILE__,
           __LINE__);
    return -1;
  }
  std::string strTcp;
  std::string strUdp;
  for (int i = 0; i < sections->nItem; ++i) {
    const ZARK_FW_SERVICE *pService =
        ZARKFWServiceFind(mFwServiceTable, KLIBCSzListGet(sections, i));
    if (NULL == pService) {
      return 0;
    }
    std::string strJoined;
    if (NULL != pService->pslPorts) {
      for (int j = 0; j < pService->pslPorts->nItem; ++j) {
        if (0 < j) {
          strJoined += ",";
        }
        strJoined += KLIBCSzListGet(pService->pslPorts, j);
      }
    }
    if (pService->protoMask & ZARK_FW_PROTO_TCP) {
      AppendPortList(strTcp, strJoined);
    }
    if (pService->protoMask & ZARK_FW_PROTO_UDP) {
      AppendPortList(strUdp, strJoined);
    }
  }
  if (!strTcp.empty() &&
      !writer.AddRule(std::string(serviceId) + ".tcp", true, strTcp, strTcp,
                      "tcp", serviceId, "")) {
    return -1;
  }
  if (!strUdp.empty() &&
      !writer.AddRule(std::string(serviceId) + ".udp", true, strUdp, strUdp,
                      "udp", serviceId, "")) {
    return -1;
  }
  return 0;
}
