// Rules screen: the port-forwarding rules, edited on the page and then saved
// and applied on the router in one background job.

import { describeError } from '../api/errors';
import { getRouterDesc, loadRules, saveRules, type Rule } from '../api/portforward';
import type { AppContext, Screen } from '../context';
import { h, replaceChildren } from '../dom';
import { runExclusive } from '../jobs';
import { createNotice } from '../ui/notice';
import { createProgress } from '../ui/progress';
import { createRuleForm, nextRuleId } from './ruleForm';
import { renderRulesTable } from './rulesTable';
import { SAVE_POLL, saveProgressText } from './saveProgress';

export function createRulesScreen(ctx: AppContext): Screen {
  const { client, jobs } = ctx;
  const notice = createNotice();
  const progress = createProgress('Saving progress');
  const tableBox = h('div', { class: 'rules-box' });
  const formBox = h('div', { class: 'rule-form-box' });
  const dirtyMark = h('span', { class: 'dirty', role: 'status' });
  const addButton = h('button', { type: 'button' }, 'Add rule');
  const saveButton = h('button', { type: 'button', class: 'primary' }, 'Save and apply');
  const reloadButton = h('button', { type: 'button' }, 'Reload');
  const changeNote = h('p', { class: 'hint' });

  let draft: Rule[] = [];
  let loaded = false;
  let dirty = false;
  let saving = false;
  let supportChangePort: boolean | null = null;

  const setDirty = (d: boolean) => {
    dirty = d;
    dirtyMark.textContent = d ? 'Unsaved changes: they reach the router only when saved.' : '';
  };

  const render = () => {
    replaceChildren(
      tableBox,
      renderRulesTable(draft, {
        disabled: saving,
        onToggle: (i, on) => {
          draft[i] = { ...draft[i]!, enable: on };
          setDirty(true);
          render();
        },
        onEdit: (i) => openForm(i),
        onDelete: (i) => {
          draft.splice(i, 1);
          setDirty(true);
          closeForm();
          render();
        },
      }),
    );
    addButton.disabled = saving || !loaded;
    saveButton.disabled = saving || !loaded;
    reloadButton.disabled = saving;
  };

  const closeForm = () => replaceChildren(formBox);

  const openForm = (index: number | null) => {
    const initial = index === null ? null : draft[index]!;
    const f = createRuleForm({
      initial,
      supportChangePort,
      onCancel: closeForm,
      onDone: (fields) => {
        if (index === null) {
          draft.push({ rule_id: nextRuleId(draft), serviceid: '', service_name: '', ...fields });
        } else {
          draft[index] = { ...draft[index]!, ...fields };
        }
        setDirty(true);
        closeForm();
        render();
      },
    });
    replaceChildren(formBox, f.el);
    f.focus();
  };

  // Reads the rules and the router's abilities; false when the rules could
  // not be read (the error is shown).
  async function load(): Promise<boolean> {
    let loadedOk = false;
    notice.clear();
    closeForm();
    replaceChildren(tableBox, h('p', { class: 'loading' }, 'Reading the rules…'));
    try {
      const rules = await loadRules(client);
      draft = Array.isArray(rules) ? rules.map((r) => ({ ...r })) : [];
      loaded = true;
      setDirty(false);
      render();
      loadedOk = true;
    } catch (e) {
      loaded = false;
      replaceChildren(tableBox);
      notice.error(e, 'rules');
      render();
    }
    try {
      const desc = await getRouterDesc(client);
      supportChangePort = typeof desc?.support_change_port === 'boolean' ? desc.support_change_port : null;
      changeNote.textContent =
        supportChangePort === false
          ? 'This router forwards each port to the same local port only.'
          : supportChangePort
            ? 'This router can forward a router port to a different local port.'
            : '';
    } catch (e) {
      supportChangePort = null;
      changeNote.textContent = `Whether the router can forward to a different local port is unknown (${
        describeError(e, 'router-conf').title
      }); the router decides when saving.`;
    }
    return loadedOk;
  }

  async function save(): Promise<void> {
    notice.clear();
    closeForm();
    saving = true;
    render();
    progress.set(0, 'Starting');
    try {
      await runExclusive(client, jobs, 'saving rules', () =>
        saveRules(client, draft, {
          ...SAVE_POLL,
          signal: ctx.signal,
          onUpdate: (s) => {
            const p = saveProgressText(s);
            progress.set(p.percentage, p.text);
          },
        }),
      );
      progress.set(100, 'Saved and applied on the router');
      saving = false;
      // The progress line keeps saying that the save worked if the reload fails.
      if (await load()) notice.success('The rules were saved and applied on the router.');
    } catch (e) {
      progress.hide();
      notice.error(e, 'save');
    } finally {
      saving = false;
      render();
    }
  }

  addButton.addEventListener('click', () => openForm(null));
  saveButton.addEventListener('click', () => void save());
  reloadButton.addEventListener('click', () => {
    if (dirty && !window.confirm('Discard the unsaved changes?')) return;
    void load();
  });
  window.addEventListener('beforeunload', (ev) => {
    if (dirty) ev.preventDefault();
  });

  const el = h(
    'section',
    { class: 'screen', id: 'screen-rules', 'aria-labelledby': 'rules-title' },
    h('h2', { id: 'rules-title' }, 'Rules'),
    h(
      'section',
      { class: 'card' },
      notice.el,
      changeNote,
      tableBox,
      dirtyMark,
      formBox,
      h('div', { class: 'actions' }, addButton, saveButton, reloadButton),
      progress.el,
    ),
  );
  render();

  return {
    id: 'rules',
    title: 'Rules',
    el,
    enter() {
      if (!loaded && !saving) void load();
    },
  };
}
