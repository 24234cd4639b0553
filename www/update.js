// The sample update page: polls /api/status every second and posts the four actions.
"use strict";

const state = { busy: "", status: null };

const el = (id) => document.getElementById(id);

// Words a person understands for kytoupdate's exit codes.
const EXIT_WORDS = {
  1: "The operation failed.",
  2: "The update server could not be reached.",
  3: "The system is up to date.",
  4: "The download was stopped.",
  5: "Refused: the update is not signed by a trusted key.",
  64: "The request was not understood.",
};

function showMessage(text, isError) {
  const m = el("message");
  m.textContent = text;
  m.className = isError ? "error" : "";
}

// "smallupdate VYX 5.2-5644 update 2" -> kind and version.
function offerText(check) {
  if (!check) return "Not checked yet.";
  if (check.exit === 3) return "None: the system is up to date.";
  if (check.exit !== 0) return EXIT_WORDS[check.exit] || "The check failed.";
  const words = check.output.split(" ");
  const kind = words[0] === "vyx" ? "Full release" : "Small update";
  return kind + ": " + words.slice(1).join(" ");
}

function downloadWords(s) {
  const vyx = s.vyxupdate, small = s.smallupdate;
  if (vyx.status === "downloading" || small.status === "downloading" || small.status === "init")
    return "downloading";
  if (s.downloaded) return "downloaded";
  if (vyx.status === "failed" || small.status === "failed") return "failed";
  if (vyx.status === "stopped" || small.status === "stopped") return "cancelled";
  return "none";
}

function render(data) {
  state.status = data;
  el("installed").textContent = data.installed.version;
  el("smallfix").textContent = String(data.installed.smallfix);
  el("offer").textContent = offerText(data.check);
  const s = data.status;
  if (!s) {
    showMessage(data.error || "The status could not be read.", true);
    return;
  }
  const vyx = s.downloading === "vyx" || s.downloaded === "vyx";
  const pct = vyx ? s.vyxupdate.percentage : s.smallupdate.percentage;
  const words = downloadWords(s);
  const shown = words === "none" ? 0 : Math.max(0, Math.min(100, pct));
  el("bar-fill").style.width = shown + "%";
  el("percent").textContent = shown + "%";
  const pkg = /package (\d+) of (\d+)/.exec(data.progress || "");
  el("items").textContent = vyx && s.vyxupdate.images > 0
    ? "(image " + s.vyxupdate.image + " of " + s.vyxupdate.images + ")"
    : words === "downloading" && pkg ? "(package " + pkg[1] + " of " + pkg[2] + ")" : "";
  el("download-state").textContent = words;
  el("apply-state").textContent = s.apply.stage === "none" ? "Not applied." :
    s.apply.stage + " " + s.apply.percentage + "%" + (s.apply.error ? " (" + s.apply.error + ")" : "");
  const last = data.last;
  if (last && !last.running && last.exit !== 0 && !state.busy) {
    showMessage(last.action + ": " + (last.message || EXIT_WORDS[last.exit] || "failed"), true);
  }
  buttons(words, data);
}

function buttons(words, data) {
  const busy = state.busy !== "";
  const offered = data.check && data.check.exit === 0;
  el("check").disabled = busy || words === "downloading";
  el("download").disabled = busy || !offered || words === "downloaded";
  el("cancel").disabled = words !== "downloading";
  el("apply").disabled = busy || words !== "downloaded" || data.status.downloaded !== "smallupdate";
}

async function poll() {
  try {
    const r = await fetch("/api/status", { cache: "no-store" });
    render(await r.json());
  } catch (e) {
    showMessage("The appliance does not answer (" + e.message + ").", true);
  }
}

async function act(action) {
  state.busy = action;
  showMessage(action + "…", false);
  try {
    const r = await fetch("/api/" + action, { method: "POST" });
    const body = await r.json();
    if (!r.ok) {
      showMessage(action + ": " + (body.error || r.statusText), true);
    } else if (body.running) {
      showMessage("Download started.", false);
    } else if (body.exit === 0) {
      showMessage(action + ": " + (body.output || "done"), false);
    } else if (action === "check" && body.exit === 3) {
      showMessage("The system is up to date.", false);
    } else {
      showMessage(action + ": " + (body.message || EXIT_WORDS[body.exit] || "failed"), true);
    }
  } catch (e) {
    showMessage(action + ": the appliance does not answer (" + e.message + ").", true);
  }
  state.busy = "";
  await poll();
}

for (const action of ["check", "download", "cancel", "apply"]) {
  el(action).addEventListener("click", () => act(action));
}
poll();
setInterval(poll, 1000);
