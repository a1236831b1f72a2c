// A package's wizard pages (docs/package-format.md, "Wizard pages") as
// forms. The API hands them over URL-encoded; the answers go back as one
// JSON object of key -> value that the package's scripts receive.

export interface WizardSubitem {
  key: string;
  desc?: string;
  defaultValue?: unknown;
  emptyText?: string;
  allowBlank?: boolean;
  regex?: string;
  invalidText?: string;
  options?: (string | { value: string; label?: string })[];
}

export interface WizardItem {
  type: string;
  desc?: string;
  subitems: WizardSubitem[];
}

export interface WizardStep {
  step_title: string;
  items: WizardItem[];
}

export type WizardValues = Record<string, string | boolean>;

const kFieldTypes = new Set(['textfield', 'password', 'singleselect', 'multiselect', 'combobox']);

function isObject(value: unknown): value is Record<string, unknown> {
  return typeof value === 'object' && value !== null && !Array.isArray(value);
}

function readSubitem(value: unknown): WizardSubitem | null {
  if (!isObject(value) || typeof value.key !== 'string' || value.key === '') return null;
  return value as unknown as WizardSubitem;
}

function readItem(value: unknown): WizardItem | null {
  if (!isObject(value) || typeof value.type !== 'string') return null;
  const subitems = Array.isArray(value.subitems) ? value.subitems.map(readSubitem) : [];
  if (subitems.some((s) => s === null)) return null;
  return { type: value.type, desc: typeof value.desc === 'string' ? value.desc : undefined, subitems: subitems as WizardSubitem[] };
}

// The steps in `encoded` (URL-encoded JSON, as the API sends them), or null
// when there are none or they are not a list of steps. Items of a type this
// page does not know are kept and shown as their description only.
export function decodeWizard(encoded: unknown): WizardStep[] | null {
  if (typeof encoded !== 'string' || encoded === '') return null;
  let parsed: unknown;
  try {
    parsed = JSON.parse(decodeURIComponent(encoded));
  } catch {
    return null;
  }
  if (!Array.isArray(parsed) || parsed.length === 0) return null;
  const steps: WizardStep[] = [];
  for (const step of parsed) {
    if (!isObject(step) || !Array.isArray(step.items)) return null;
    const items = step.items.map(readItem);
    if (items.some((i) => i === null)) return null;
    steps.push({ step_title: typeof step.step_title === 'string' ? step.step_title : '', items: items as WizardItem[] });
  }
  return steps;
}

function isChoice(type: string): boolean {
  return type === 'singleselect' || type === 'multiselect';
}

function optionValues(sub: WizardSubitem): { value: string; label: string }[] {
  return (sub.options ?? []).map((o) => (typeof o === 'string' ? { value: o, label: o } : { value: o.value, label: o.label ?? o.value }));
}

// The answers before the user changes anything: each field's default, and
// in a single choice the first option when none is marked.
export function initialWizardValues(steps: WizardStep[]): WizardValues {
  const values: WizardValues = {};
  for (const item of steps.flatMap((s) => s.items)) {
    if (!kFieldTypes.has(item.type)) continue;
    for (const sub of item.subitems) {
      if (isChoice(item.type)) values[sub.key] = sub.defaultValue === true;
      else if (item.type === 'combobox') values[sub.key] = String(sub.defaultValue ?? optionValues(sub)[0]?.value ?? '');
      else values[sub.key] = sub.defaultValue === undefined ? '' : String(sub.defaultValue);
    }
    if (item.type === 'singleselect' && item.subitems.length > 1 && !item.subitems.some((s) => values[s.key] === true))
      values[item.subitems[0].key] = true;
  }
  return values;
}

// What keeps the user on `step`, in words, or null when its answers are fine.
export function wizardStepProblem(step: WizardStep, values: WizardValues): string | null {
  for (const item of step.items) {
    if (item.type !== 'textfield' && item.type !== 'password') continue;
    for (const sub of item.subitems) {
      const text = String(values[sub.key] ?? '');
      const name = sub.desc ?? sub.key;
      if (text === '' && sub.allowBlank === false) return `${name} is required.`;
      if (text !== '' && sub.regex && !safeRegex(sub.regex).test(text)) return sub.invalidText ?? `${name} is not valid.`;
    }
  }
  return null;
}

// A package's pattern that does not compile accepts everything rather than
// locking the user out of the install.
function safeRegex(pattern: string): RegExp {
  try {
    return new RegExp(pattern);
  } catch {
    return /.*/;
  }
}

function Field({
  item,
  sub,
  values,
  onChange,
}: {
  item: WizardItem;
  sub: WizardSubitem;
  values: WizardValues;
  onChange: (next: WizardValues) => void;
}) {
  const id = `wizard-${sub.key}`;
  const set = (value: string | boolean) => onChange({ ...values, [sub.key]: value });
  const label = sub.desc ?? sub.key;
  // A single choice with one option is a yes/no question: a lone radio
  // button could never be unticked.
  if (item.type === 'singleselect' && item.subitems.length > 1) {
    const pick = () => {
      const next = { ...values };
      for (const other of item.subitems) next[other.key] = other.key === sub.key;
      onChange(next);
    };
    return (
      <label class="choice">
        <input type="radio" name={`wizard-${item.subitems[0].key}-group`} checked={values[sub.key] === true} onChange={pick} /> {label}
      </label>
    );
  }
  if (isChoice(item.type)) {
    return (
      <label class="choice">
        <input type="checkbox" checked={values[sub.key] === true} onChange={(e) => set(e.currentTarget.checked)} /> {label}
      </label>
    );
  }
  if (item.type === 'combobox') {
    return (
      <div class="field">
        <label for={id}>{label}</label>
        <select id={id} value={String(values[sub.key] ?? '')} onChange={(e) => set(e.currentTarget.value)}>
          {optionValues(sub).map((o) => (
            <option key={o.value} value={o.value}>
              {o.label}
            </option>
          ))}
        </select>
      </div>
    );
  }
  return (
    <div class="field">
      <label for={id}>{label}</label>
      <input
        id={id}
        type={item.type === 'password' ? 'password' : 'text'}
        placeholder={sub.emptyText}
        required={sub.allowBlank === false}
        value={String(values[sub.key] ?? '')}
        onInput={(e) => set(e.currentTarget.value)}
      />
    </div>
  );
}

// One step of a package's wizard as a form.
export function WizardStepForm({
  step,
  values,
  onChange,
}: {
  step: WizardStep;
  values: WizardValues;
  onChange: (next: WizardValues) => void;
}) {
  return (
    <div class="wizard-step">
      {step.items.map((item, i) => {
        const fields = kFieldTypes.has(item.type)
          ? item.subitems.map((sub) => <Field key={sub.key} item={item} sub={sub} values={values} onChange={onChange} />)
          : null;
        const group = isChoice(item.type);
        return group ? (
          <fieldset key={i}>
            {item.desc && <legend>{item.desc}</legend>}
            {fields}
          </fieldset>
        ) : (
          <div key={i} class="wizard-item">
            {item.desc && <p>{item.desc}</p>}
            {fields}
          </div>
        );
      })}
    </div>
  );
}
