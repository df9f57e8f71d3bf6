// The port-forwarding module's web API: names, answer shapes and one typed
// function per method. Each long job is started with its start method, which
// answers {"task_id"}, and followed with its status method, which takes that
// "task_id".

import { ApiClient, ApiError, BAD_ANSWER, isApiError } from './client';
import { HostCode } from './codes';
import { poll, type PollOptions } from '../poll';

export const API = {
  Base: 'ZARK.Core.PortForwarding',
  RouterConf: 'ZARK.Core.PortForwarding.RouterConf',
  RouterList: 'ZARK.Core.PortForwarding.RouterList',
  Rules: 'ZARK.Core.PortForwarding.Rules',
  Serv: 'ZARK.Core.PortForwarding.Rules.Serv',
  Compat: 'ZARK.Core.PortForwarding.Compatibility',
} as const;

// ---- answer shapes ---------------------------------------------------------

export type StepName =
  | 'check_interface_enable_step'
  | 'check_gateway_setting_step'
  | 'check_connect_wan_step'
  | 'check_hops_lan2wan_step'
  | 'check_dns_setting_step'
  | 'detect_router_step';

export const STEP_ORDER: readonly StepName[] = [
  'check_interface_enable_step',
  'check_gateway_setting_step',
  'check_connect_wan_step',
  'check_hops_lan2wan_step',
  'check_dns_setting_step',
  'detect_router_step',
];

export type StepStatus = 'initial' | 'processing' | 'success' | 'warning' | 'failed' | 'stop';

export interface DetectStep {
  status: StepStatus | string;
  check_id?: number;
  warning_type?: 'get_hops_fail' | 'hops_over_one' | string;
  network_interface?: string;
  gateway_ip?: string;
  hops_number?: number;
}

export type DetectProgress = Partial<Record<StepName, DetectStep>>;

export interface DetectAnswer {
  status: string; // "processing" while running; "success" (or "failed") at the end
  percentage: number; // the stage number while running, 100 at the end
  progress?: DetectProgress | null;
  support_upnp?: string; // "yes" | "no" | "unknown"
  support_natpmp?: string;
  router_brand?: string;
  router_model?: string;
  router_version?: string;
  upnp_pfpath?: string;
  router_user_setting_name?: string;
  router_max_rule?: number;
}

export interface CurrentProcess {
  process: 'none' | 'autotest' | 'portforwarding' | string;
}

export interface RouterDbEntry {
  router_brand: string;
  router_model: string;
  router_version: string;
  generic: boolean;
}

export interface RouterConf {
  router_brand: string;
  router_model: string;
  router_version: string;
  support_upnp: string;
  support_natpmp: string;
  router_port: string;
  router_protocol: string;
  router_max_rule: string;
}

export interface RouterConfInput {
  router_brand: string;
  router_model: string;
  router_version: string;
  support_upnp: 'yes' | 'no';
  support_natpmp: 'yes' | 'no';
  router_protocol?: string;
  router_port?: number; // an integer on input, although "get" answers text
  router_account?: string;
  router_pass?: string;
}

export interface Rule {
  enable: boolean;
  rule_id: string;
  router_protocol: string;
  router_port: string;
  ds_port: string;
  serviceid: string;
  service_name: string;
}

export interface SaveStatus {
  status: string; // "processing" ... "success"
  percentage: number;
  stage?: 'del' | 'add' | string;
}

export interface TestStatus {
  status: 'wait' | 'update' | 'success' | string;
  rules?: Record<string, string>;
}

export interface ServiceStatus {
  service_id: string;
  status: 'allow' | 'deny' | 'unknown' | string;
  port_info?: Record<string, 'allow' | 'deny' | string>;
}

export interface PfPolicy {
  add?: string[];
  remove?: string[];
}

export interface CompatItem {
  test_item: 'add' | 'max' | 'del' | 'readd' | 'con_s' | string;
  status: string;
}

export interface CompatStatus {
  test: CompatItem[];
  status: 'processing' | 'success' | 'failed' | string;
  percentage: number;
}

// ---- background jobs -------------------------------------------------------

export interface TaskStart {
  task_id: string;
}

// How a caller follows a job: interval, bound, updates, stop signal. When the
// job is finished is the method's business.
export type TaskPollOptions<T> = Omit<PollOptions<T>, 'isDone' | 'isTransient' | 'maxTransient'> & {
  onStarted?: (taskId: string) => void;
};

// A status method whose task has not reported yet can end without an answer
// (109); a few of those in a row are waited out.
export function isSettlingError(e: unknown): boolean {
  return isApiError(e) && e.code === HostCode.NoAnswer;
}

export async function startTask(
  client: ApiClient,
  api: string,
  method: string,
  params: Record<string, unknown> = {},
): Promise<string> {
  const data = await client.call<TaskStart | null>(api, method, params);
  if (!data || typeof data.task_id !== 'string' || data.task_id === '') {
    throw new ApiError(BAD_ANSWER, data, {
      message: `${method} did not answer a task id`,
      api,
      method,
    });
  }
  return data.task_id;
}

export async function runTask<T>(
  client: ApiClient,
  api: string,
  start: string,
  status: string,
  params: Record<string, unknown>,
  isDone: (answer: T) => boolean,
  opts: TaskPollOptions<T>,
): Promise<T> {
  const taskId = await startTask(client, api, start, params);
  opts.onStarted?.(taskId);
  return poll(() => client.call<T>(api, status, { task_id: taskId }), {
    ...opts,
    isDone,
    isTransient: isSettlingError,
    maxTransient: 5,
  });
}

// ---- methods -----------------------------------------------------------------

export const getCurrentProcess = (c: ApiClient) =>
  c.call<CurrentProcess>(API.Base, 'get_current_process');

export function isDetectFinished(a: DetectAnswer): boolean {
  const s = (a?.status ?? '').toLowerCase();
  return s === 'success' || s === 'failed';
}

export const detect = (c: ApiClient, opts: TaskPollOptions<DetectAnswer>) =>
  runTask<DetectAnswer>(c, API.Base, 'detect', 'detect_status', {}, isDetectFinished, opts);

export const getRouterConf = (c: ApiClient) => c.call<RouterConf>(API.RouterConf, 'get');
export const setRouterConf = (c: ApiClient, conf: RouterConfInput) =>
  c.call<unknown>(API.RouterConf, 'set', { ...conf });

export const getRouterDesc = (c: ApiClient) =>
  c.call<{ support_change_port: boolean }>(API.RouterList, 'get');
export const listRouters = (c: ApiClient) =>
  c.call<{ routers: RouterDbEntry[] }>(API.RouterList, 'list');
export const updateRouterDb = (c: ApiClient) =>
  c.call<{ router_version: number }>(API.RouterList, 'update');

export const loadRules = (c: ApiClient) => c.call<Rule[]>(API.Rules, 'load');

export function isSaveFinished(a: SaveStatus): boolean {
  return a?.status === 'success' && a.percentage === 100;
}

export const saveRules = (c: ApiClient, rules: Rule[], opts: TaskPollOptions<SaveStatus>) =>
  runTask<SaveStatus>(c, API.Rules, 'save', 'save_status', { rules }, isSaveFinished, opts);

export const savePolicy = (c: ApiClient, policy: PfPolicy, opts: TaskPollOptions<SaveStatus>) =>
  runTask<SaveStatus>(c, API.Rules, 'save', 'save_status', { pf_policy: policy }, isSaveFinished, opts);

export function isTestFinished(a: TestStatus): boolean {
  return a?.status === 'success';
}

export const testRules = (c: ApiClient, opts: TaskPollOptions<TestStatus>) =>
  runTask<TestStatus>(c, API.Rules, 'test', 'test_status', {}, isTestFinished, opts);

export const testServices = (c: ApiClient, serviceIds: string[], opts: TaskPollOptions<TestStatus>) =>
  runTask<TestStatus>(c, API.Serv, 'test', 'test_status', { service_id: serviceIds }, isTestFinished, opts);

// Without ids every service of the server is checked.
export const checkServices = (c: ApiClient, serviceIds?: string[]) =>
  c.call<{ service_status: ServiceStatus[] }>(
    API.Serv,
    'check',
    serviceIds && serviceIds.length > 0 ? { service_id: serviceIds } : {},
  );

export function isCompatFinished(a: CompatStatus): boolean {
  return a?.status === 'success' || a?.status === 'failed';
}

export const startCompatTest = (c: ApiClient) => startTask(c, API.Compat, 'test');
export const compatStatus = (c: ApiClient, taskId: string) =>
  c.call<CompatStatus>(API.Compat, 'test_status', { task_id: taskId });
export const stopCompatTest = (c: ApiClient) => c.call<unknown>(API.Compat, 'stop');
export const uploadCompatResult = (c: ApiClient) => c.call<unknown>(API.Compat, 'upload');
