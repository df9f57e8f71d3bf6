// Error codes that answers can carry, in two separate spaces.

// Codes answered by the web API host and its framework.
export const HostCode = {
  Internal: 100, // internal error of the host or framework
  BadField: 101, // a required field is missing or malformed
  UnknownApi: 102, // the API name is not served
  UnknownMethod: 103, // the API has no such method
  BadVersion: 104, // the API does not serve this version
  NotAllowed: 105, // the caller may not use this method (also: logins slowed down)
  NotLoggedIn: 106, // no valid session
  BadToken: 107, // the session's token is missing or wrong
  TooLarge: 108, // request beyond the size bounds
  NoAnswer: 109, // the method finished without answering
  TaskCrashed: 110, // a background task's callback threw
  TaskNotStarted: 111, // a background task could not be started
} as const;

// Codes answered by the port-forwarding module.
export const ModuleCode = {
  BadParameter: 114, // missing request/response object or bad parameter
  TaskListFailed: 117, // the task sweep could not list tasks
  Failed: 1500, // failure without a particular code
  Busy: 1501, // port-map lock busy, router not configured/supported, or detection could not start
  NoExternalAddress: 1502, // external address unknown
  NoGateway: 1503, // default gateway unknown
  RouterDbUpdateFailed: 1510, // router database update failed
  PortTooHigh: 1521, // a port above the router's highest port ("max_port")
  TooManyPorts: 1522, // more ports in one rule than allowed ("max_port")
  RangeTooLong: 1523, // a range too long ("max_port", "max_range")
  TooManyRules: 1524, // more rules than the router takes ("max_port")
  BadPortText: 1525, // a port text the router does not take (the text)
  BadProtocolText: 1526, // a protocol text the router does not take (the text)
  PolicyNotWritten: 1527, // the service policy could not be written
  RouterDbSyntax: 1530, // router database syntax version error
  ServiceCheckRefused: 9999, // the service status check was refused
} as const;
