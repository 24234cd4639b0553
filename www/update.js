// The sample update page: polls /api/status every second and posts the four actions.
// Every word about an action's end comes from the back end (its "words" and "message").
"use strict";

// busy: the action being posted; shownEnd: the action end last put into the message.
const state = { busy: "", status: null, shownEnd: "" };

const el = (id) => document.getElementById(id);

function showMessage(text, isError) {
  const m = el("message");
  m.textContent = text;
  m.className = isError ? "error" : "";
}

// What a finished action says: its result line when it succeeded, else kytoupdate's own
// note when it left one, else the back end's sentence for its exit code.
function endText(end) {
  const text = end.exit === 0 ? end.output : end.message;
  return end.action + ": " + (text || end.words);
}

// An end a person asked for or should simply know: up to date, a download they cancelled.
function isError(end) {
  return end.exit !== 0 && !(end.action === "check" && end.exit === 3) &&
    !(end.action === "download" && end.exit === 4);
}

// The check's answer "smallupdate VYX 5.2-5644 update 2" as kind and version.  An apply
// consumes the offer.
function offerText(check, last) {
  if (!check && last && last.action === "apply") return "Not checked since the last apply.";
  if (!check) return "Not checked yet.";
  if (check.exit !== 0) return check.words;
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

// "(image 1 of 1)" from the status, or "(package 2 of 3)" from the download's progress line.
function itemsText(s, words, vyx, progress) {
  if (vyx && s.vyxupdate.images > 0)
    return "(image " + s.vyxupdate.image + " of " + s.vyxupdate.images + ")";
  const pkg = /package (\d+) of (\d+)/.exec(progress || "");
  return words === "downloading" && pkg ? "(package " + pkg[1] + " of " + pkg[2] + ")" : "";
}

function applyText(s) {
  const a = s.apply;
  if (s.downloaded === "vyxupdate")
    return "The downloaded release is installed by the installer, not from this page.";
  if (a.stage === "none") return "Not applied.";
  if (a.stage === "reboot") return "Applied: restart the appliance to finish the update.";
  return a.stage + " " + a.percentage + "%" + (a.error ? " (error: " + a.error + ")" : "");
}

function render(data) {
  state.status = data;
  el("offer").textContent = offerText(data.check, data.last);
  const s = data.status;
  if (!s) {
    showMessage(data.error || "The status could not be read.", true);
    return;
  }
  el("installed").textContent = s.installed.version;
  el("smallfix").textContent = String(s.installed.smallfix);
  const vyx = s.downloading === "vyxupdate" || s.downloaded === "vyxupdate";
  const pct = vyx ? s.vyxupdate.percentage : s.smallupdate.percentage;
  const dl = data.download;
  const running = Boolean(dl && dl.running);
  let words = downloadWords(s);
  // A cancelled small update ends the package it is fetching before it stops.
  if (words === "cancelled" && running) words = "stopping";
  // A stopped or failed download leaves no status behind; the page's record tells its end.
  if (words === "none" && dl && !running && (!data.last || dl.time >= data.last.time)) {
    if (dl.exit === 4) words = "cancelled";
    else if (dl.exit === 1 || dl.exit === 5) words = "failed";
  }
  const shown = words === "none" ? 0 : Math.max(0, Math.min(100, pct));
  el("bar-fill").style.width = shown + "%";
  el("percent").textContent = shown + "%";
  el("items").textContent = itemsText(s, words, vyx, data.progress);
  el("download-state").textContent = words;
  el("apply-state").textContent = applyText(s);
  el("apply-state").className = s.apply.stage === "reboot" ? "reboot" : "";
  // The newer of the last action's end and the page's download.
  const last = [data.last, data.download].filter(Boolean).sort((a, b) => b.time - a.time)[0];
  if (last && !last.running && !state.busy && last.action + last.time !== state.shownEnd) {
    state.shownEnd = last.action + last.time;
    showMessage(endText(last), isError(last));
  }
  buttons(words, data, running);
}

function buttons(words, data, running) {
  const busy = state.busy !== "" || running;
  const offered = data.check && data.check.exit === 0;
  el("check").disabled = busy || words === "downloading";
  el("download").disabled = busy || !offered || words === "downloading" || words === "downloaded";
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
    const end = await r.json();
    if (!r.ok) showMessage(action + ": " + (end.error || r.statusText), true);
    else if (end.running) showMessage("Download started.", false);
    else showMessage(endText(end), isError(end));
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
