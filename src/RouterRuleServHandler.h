// RouterRuleServHandler: TCP and UDP port maps, the resolution of services
// to firewall sections and ports, the forwarding status of services, and the
// rewriting of the rule set so that services get their ports.
#ifndef ZARK_CORE_PORTFORWARDING_ROUTERRULESERVHANDLER_H
#define ZARK_CORE_PORTFORWARDING_ROUTERRULESERVHANDLER_H

#include "RouterRuleConf.h"
#include "klibc.h"
#include "zarkfw.h"

#include <json/json.h>

#include <bitset>
#include <string>

class RouterRuleServHandler {
public:
  RouterRuleServHandler();
  ~RouterRuleServHandler();
  RouterRuleServHandler(const RouterRuleServHandler &) = delete;
  RouterRuleServHandler &operator=(const RouterRuleServHandler &) = delete;

  // Port maps.
  void FillTCPBitSet(int first, int last);
  void FillUDPBitSet(int first, int last);
  bool CheckTCPBitSet(int first, int last);
  bool CheckUDPBitSet(int first, int last);
  int FillPortMapByPorts(int protoMask, KLIBSZLIST *ports);
  int FillPortMapByPorts(const std::string &tcpPorts,
                         const std::string &udpPorts);
  int CheckPort(std::string proto, int port);
  void FilterOutPorts(const std::string &proto, int first, int last,
                      std::string &out);
  int RemoveConflictPort(std::string proto, KLIBSZLIST *ports,
                         std::string &out);

  // Services and firewall sections.
  int FwSectionEnum();
  int ReadPackageServiceSections(const char *serviceId, KLIBSZLIST **sections);
  int GetServiceSections(const char *serviceId, KLIBSZLIST *systemServices,
                         KLIBSZLIST **sections);
  int RemoveSection(KLIBSZLIST *sections);
  int FillPortMapByFwSection(KLIBSZLIST *sections);
  int FillPortMapByServ(const Json::Value &services);

  // Forwarding status of services.
  int GetServPfStatus(const Json::Value &serviceIds, Json::Value &out);
  int FillPortMapByPfRules();
  int CheckPfRulesByPorts(int protoMask, KLIBSZLIST *ports);
  void CheckPfRulesByFwSection(KLIBSZLIST *sections, Json::Value &result);

  // Rules for services.
  int SetServPfRules(const Json::Value &policy, RouterRuleConfWriter &writer);
  int WriteOrgPfRules(RouterRuleConfWriter &writer, int *ruleId);
  int AddPfRuleByServ(RouterRuleConfWriter &writer, const Json::Value &services,
                      int *ruleId);
  int AddPfRuleByFwSction(RouterRuleConfWriter &writer, KLIBSZLIST *sections,
                          int *ruleId);
  int SetServPfTestRules(const Json::Value &services);
  int AddPfRuleByServ(RouterRuleConfWriter &writer,
                      const Json::Value &services);
  int AddPfRuleByFwSction(const char *serviceId, KLIBSZLIST *sections,
                          RouterRuleConfWriter &writer);

private:
  ZARK_FW_SERVICE_TABLE *mFwServiceTable;
  std::bitset<65536> mTCPPortMap;
  std::bitset<65536> mUDPPortMap;
};

#endif
