// The rules screen: the performance-event rules with a switch each, several
// switched or deleted at once, and the dialog that creates and changes them.

import {call} from '../api.js';
import {errorText} from '../errors.js';
import {define, t} from '../i18n.js';
import {kRuleApi, openRuleDialog, ruleLabel, ruleObject, ruleThreshold} from '../rule_dialog.js';
import {confirmDialog, h, showStatus} from '../ui.js';

define({
  enu: {
    'rules.new': 'New rule',
    'rules.select_all': 'Select all',
    'rules.selected': '{count} selected',
    'rules.switch_on': 'Switch on',
    'rules.switch_off': 'Switch off',
    'rules.delete': 'Delete',
    'rules.choose': 'Selection',
    'rules.actions': 'Actions',
    'rules.on': 'On',
    'rules.off': 'Off',
    'rules.edit': 'Edit',
    'rules.select_one': 'Select {rule}',
    'rules.enabled_one': 'Enabled: {rule}',
    'rules.edit_one': 'Edit {rule}',
    'rules.none': 'No rules yet.',
    'rules.saved': 'The rule is saved.',
    'rules.switched_on': 'Rules switched on: {count}',
    'rules.switched_off': 'Rules switched off: {count}',
    'rules.delete_question': 'Delete the selected rules ({count})?',
    'rules.deleted': 'Rules deleted: {count}',
  },
  ger: {
    'rules.new': 'Neue Regel',
    'rules.select_all': 'Alle auswählen',
    'rules.selected': '{count} ausgewählt',
    'rules.switch_on': 'Einschalten',
    'rules.switch_off': 'Ausschalten',
    'rules.delete': 'Löschen',
    'rules.choose': 'Auswahl',
    'rules.actions': 'Aktionen',
    'rules.on': 'Ein',
    'rules.off': 'Aus',
    'rules.edit': 'Bearbeiten',
    'rules.select_one': '{rule} auswählen',
    'rules.enabled_one': 'Aktiviert: {rule}',
    'rules.edit_one': '{rule} bearbeiten',
    'rules.none': 'Noch keine Regeln.',
    'rules.saved': 'Die Regel ist gespeichert.',
    'rules.switched_on': 'Regeln eingeschaltet: {count}',
    'rules.switched_off': 'Regeln ausgeschaltet: {count}',
    'rules.delete_question': 'Die ausgewählten Regeln löschen ({count})?',
    'rules.deleted': 'Regeln gelöscht: {count}',
  },
});

export async function mount(container) {
  let rules = [];
  const selected = new Set();
  let dialog = null;
  let left = false;

  const all = h('input', {id: 'rules-all', type: 'checkbox', onchange: () => {
    for (const rule of rules) {
      if (all.checked) selected.add(rule.id);
      else selected.delete(rule.id);
    }
    render();
  }});
  const count = h('span', {class: 'muted', 'aria-live': 'polite'});
  const bulk = [
    h('button', {type: 'button', onclick: () => switchRules([...selected], true)}, t('rules.switch_on')),
    h('button', {type: 'button', onclick: () => switchRules([...selected], false)}, t('rules.switch_off')),
    h('button', {type: 'button', class: 'danger', onclick: deleteSelected}, t('rules.delete')),
  ];
  const newButton = h('button', {type: 'button', class: 'primary', onclick: () => edit(null)}, t('rules.new'));
  const note = h('p', {class: 'error', role: 'alert'});
  const body = h('tbody');
  const column = (key) => h('th', {scope: 'col'}, t(key));
  const hidden = (key) => h('th', {scope: 'col'}, h('span', {class: 'rules-hidden'}, t(key)));
  container.append(
    h('div', {class: 'toolbar rules-toolbar'},
      newButton,
      h('div', {class: 'rules-bulk'},
        h('label', {class: 'rules-all'}, all, ` ${t('rules.select_all')}`), count, bulk)),
    note,
    h('div', {class: 'table-wrap'},
      h('table', {class: 'rules-table', 'aria-labelledby': 'screen-heading'},
        h('thead', {}, h('tr', {}, hidden('rules.choose'), column('rule.object'), column('rule.resource'),
                               column('rule.severity'), column('rule.threshold'), column('rule.enabled'),
                               hidden('rules.actions'))),
        body)));

  function row(rule) {
    const label = ruleLabel(rule);
    const level = rule.severity === 2 ? 'Critical' : 'Warning';
    return h('tr', {dataset: {id: rule.id}},
      h('td', {class: 'rules-pick'}, h('input', {
        type: 'checkbox', checked: selected.has(rule.id), 'aria-label': t('rules.select_one', {rule: label}),
        dataset: {control: 'pick'},
        onchange: (event) => {
          if (event.target.checked) selected.add(rule.id);
          else selected.delete(rule.id);
          showSelection();
        },
      })),
      h('td', {class: 'rules-object'}, ruleObject(rule)),
      h('td', {class: 'rules-resource'}, t(`rule.resource.${rule.resource}`)),
      h('td', {class: 'rules-severity'},
        h('span', {class: `level level-${level}`}, t(`rule.severity.${rule.severity}`))),
      h('td', {class: 'rules-threshold'}, ruleThreshold(rule)),
      h('td', {class: 'rules-switch'}, h('label', {},
        h('input', {type: 'checkbox', role: 'switch', checked: rule.enable, dataset: {control: 'switch'},
                    'aria-label': t('rules.enabled_one', {rule: label}),
                    onchange: (event) => switchRules([rule.id], event.target.checked)}),
        h('span', {'aria-hidden': 'true'}, t(rule.enable ? 'rules.on' : 'rules.off')))),
      h('td', {class: 'rules-edit'}, h('button', {
        type: 'button', class: 'plain', dataset: {control: 'edit'},
        'aria-label': t('rules.edit_one', {rule: label}), onclick: () => edit(rule.id),
      }, t('rules.edit'))));
  }

  function showSelection() {
    count.textContent = selected.size ? t('rules.selected', {count: selected.size}) : '';
    for (const button of bulk) button.disabled = selected.size === 0;
    all.disabled = rules.length === 0;
    all.checked = rules.length > 0 && selected.size === rules.length;
    all.indeterminate = selected.size > 0 && selected.size < rules.length;
  }

  // Draws the rows; the control that had the focus (or `focus`: {id, control})
  // gets it back in its new row.
  function render(focus = null) {
    const active = body.contains(document.activeElement) ? document.activeElement : null;
    focus ??= active && {id: active.closest('tr').dataset.id, control: active.dataset.control};
    body.replaceChildren(...(rules.length ? rules.map(row)
      : [h('tr', {}, h('td', {colspan: 7, class: 'muted rules-none'}, t('rules.none')))]));
    showSelection();
    if (focus) {
      body.querySelector(`tr[data-id="${CSS.escape(focus.id)}"] [data-control="${focus.control}"]`)?.focus();
    }
  }

  async function load(focus) {
    try {
      const answer = await call(kRuleApi, 'list');
      if (left) return;
      rules = answer.rules;
      const ids = new Set(rules.map((rule) => rule.id));
      for (const id of selected) if (!ids.has(id)) selected.delete(id);
      note.textContent = '';
      render(focus);
    } catch (error) {
      if (!left) note.textContent = errorText(error);
    }
  }

  async function switchRules(ids, enable) {
    try {
      await call(kRuleApi, 'onoff', {id_list: ids.map((id) => ({id, enable}))});
      showStatus(t(enable ? 'rules.switched_on' : 'rules.switched_off', {count: ids.length}));
    } catch (error) {
      showStatus(errorText(error), {error: true});
    }
    await load();
  }

  async function deleteSelected() {
    const ids = [...selected];
    if (!(await confirmDialog(t('rules.delete_question', {count: ids.length}), t('rules.delete')))) return;
    try {
      await call(kRuleApi, 'delete', {id_list: ids});
      showStatus(t('rules.deleted', {count: ids.length}));
    } catch (error) {
      showStatus(errorText(error), {error: true});
    }
    await load();
    // The rows and the focused Delete are gone or disabled; the keyboard goes on from here.
    if (!left) newButton.focus();
  }

  // Opens the dialog for the rule `id`, read afresh, or for a new rule.
  async function edit(id) {
    if (dialog) return;
    dialog = {close() {}};
    try {
      const rule = id === null ? null : await call(kRuleApi, 'get', {id});
      if (left) return;
      dialog = await openRuleDialog(rule);
      if (left) dialog.close();
      if (await dialog.closed) {
        showStatus(t('rules.saved'));
        await load(id === null ? null : {id, control: 'edit'});
      }
    } catch (error) {
      showStatus(errorText(error), {error: true});
      await load();
    } finally {
      dialog = null;
    }
  }

  await load();
  return {
    unmount() {
      left = true;
      dialog?.close();
    },
  };
}
