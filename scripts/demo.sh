#!/usr/bin/env bash
# The whole daemon on this machine: a temporary device root, the simulated
# modem(s) and eSE library, the daemon, and a secli session on each instance,
# printed as a transcript. Exits non-zero when any step did not give what it
# should.
set -uo pipefail
cd "$(dirname "$0")/.."

usage() {
  cat <<'EOF'
usage: scripts/demo.sh [--two-modems] [--pcsc] [--usb-modem] [--keep] [--help]

Builds the programs when needed, then in a fresh temporary device root:
writes the properties and the NFC sysfs nodes, starts modem-sim, starts the
daemon with the simulated eSE library, and runs a secli session on "eSE1" and
on "SIM1" (init, presence, ATR, logical channels, APDUs, an answer in several
parts fetched with GET RESPONSE, close, the basic channel), then an AIDL
session on "eSE1" (init, open, transmit, reset), checking every answer.
Every process it starts is stopped at the end.

  --two-modems  run a second modem-sim (modem 1, another ATR) and show "SIM1"
                following the NFC SIM switch node to it
  --pcsc        serve "eSE1" with the PC/SC library (build/lib/pcsc) through
                pcscd and the virtual card in vpcd's reader (card-vpcd), and
                pull the card out and put it back; starts pcscd in the
                foreground when none runs (as root)
  --usb-modem   serve "SIM1" from a modem that behaves as a USB modem does
                when plugged in (modem-sim --profile usb): its tty in the
                kernel's default settings, command echo, verbose errors, no
                vendor queries (presence by AT+CPIN?, no ATR)
  --keep        keep the device root (logs, properties) and print its path
  --help        this text

Environment: BUILD_DIR (default build) is where the programs are built.
EOF
}

two_modems=0
pcsc=0
usb=0
keep=0
for a in "$@"; do
  case "$a" in
    --two-modems) two_modems=1 ;;
    --pcsc) pcsc=1 ;;
    --usb-modem) usb=1 ;;
    --keep) keep=1 ;;
    -h | --help) usage; exit 0 ;;
    *) echo "demo: unknown option '$a'" >&2; usage >&2; exit 2 ;;
  esac
done

build=${BUILD_DIR:-build}
bin=$build/bin
targets=(qvese_service secli modem-sim ese_qv_hal)
[ "$pcsc" = 1 ] && targets+=(ese_qv_hal_pcsc card-vpcd)

# ---- build, quietly ---------------------------------------------------------
if [ "$pcsc" = 1 ] && ! command -v pcscd >/dev/null && [ ! -x /usr/sbin/pcscd ]; then
  scripts/deps.sh || exit 1
fi
if [ ! -f "$build/CMakeCache.txt" ] || { [ "$pcsc" = 1 ] && ! grep -q '^PCSCLITE_FOUND:INTERNAL=1' "$build/CMakeCache.txt"; }; then
  echo "demo: first run: building the daemon and the tools into $build (a few minutes)"
  scripts/deps.sh || exit 1
  if ! cmake -S . -B "$build" >"/tmp/se-demo-build.$$.log" 2>&1; then
    cat "/tmp/se-demo-build.$$.log" >&2; exit 1
  fi
fi
if ! cmake --build "$build" -j"$(nproc)" --target "${targets[@]}" >"/tmp/se-demo-build.$$.log" 2>&1; then
  cat "/tmp/se-demo-build.$$.log" >&2
  echo "demo: build failed" >&2
  exit 1
fi
rm -f "/tmp/se-demo-build.$$.log"

# ---- processes and clean-up ---------------------------------------------------
root=$(mktemp -d /tmp/se-demo.XXXXXX)
pids=()
cleanup() {
  local p
  for p in "${pids[@]}"; do kill -TERM "$p" 2>/dev/null; done
  for p in "${pids[@]}"; do wait "$p" 2>/dev/null; done
  if [ "$keep" = 1 ]; then
    echo "demo: device root kept: $root"
  else
    rm -rf "$root"
  fi
}
trap cleanup EXIT
trap 'exit 130' INT TERM
# Children die with this script even when it is killed outright, where
# setpriv can arrange it.
pd=()
setpriv --help 2>&1 | grep -q pdeathsig && pd=(setpriv --pdeathsig KILL --)

# Waits up to 10 s until FILE holds TEXT.
wait_for() {
  local file=$1 text=$2 i
  for ((i = 0; i < 200; i++)); do
    grep -qF -- "$text" "$file" 2>/dev/null && return 0
    sleep 0.05
  done
  echo "demo: gave up waiting for '$text' in $file" >&2
  return 1
}

# ---- transcript helpers ---------------------------------------------------------
steps=0
failed=0
out_fd=
err_file=
trace_seen=0
daemon_seen=0
modem_seen=0
answer=

group() { sed 's/\([0-9A-F][0-9A-F]\)/\1 /g; s/ $//' <<<"$1"; }
cla_of() { # the CLA naming logical channel $1
  if [ "$1" -lt 4 ]; then printf '%02X' "$1"; else printf '%02X' $((0x40 | ($1 - 4))); fi
}

# Starts secli on instance $1 (more secli options after it, e.g. --aidl),
# reading commands from us one at a time.
session_start() {
  err_file=$root/secli-$1${2:-}.err
  : >"$err_file"
  trace_seen=0
  coproc SECLI { exec "${pd[@]}" "$bin/secli" --root "$root" --chain --trace --timeout 20 -i "$1" "${@:2}" -f - 2>"$err_file"; }
  pids+=("$SECLI_PID")
  out_fd=${SECLI[0]}
}
session_end() {
  exec {SECLI[1]}>&-
  wait "$SECLI_PID" 2>/dev/null
}

# step WHAT EXPECT_REGEX COMMAND [DAEMON_LOG_REGEX [MODEM_LOG_REGEX]]
# Sends one command, prints it, the answer (hex grouped), the trace of a
# chained exchange and, when given, the first matching line the command
# brought to the daemon's log (AT command contents are masked there) and to
# the modem's.
step() {
  local what=$1 expect=$2 cmd=$3 logre=${4:-} modemre=${5:-}
  steps=$((steps + 1))
  printf '\n  # %s\n  > %s\n' "$what" "$cmd"
  echo "$cmd" >&"${SECLI[1]}"
  answer=
  if ! IFS= read -r -t 30 answer <&"$out_fd"; then
    answer="(no answer: $(tail -n 3 "$err_file"))"
  fi
  # Select responses in groups too.
  local shown=$answer
  if [[ $shown =~ ^(.*select=)([0-9A-F]+)(.*)$ ]]; then
    shown="${BASH_REMATCH[1]}$(group "${BASH_REMATCH[2]}")${BASH_REMATCH[3]}"
  fi
  # What went over the wire when secli had to fetch the rest itself.
  local trace
  trace=$(tail -n +$((trace_seen + 1)) "$err_file" | grep '^secli: trace')
  trace_seen=$(wc -l <"$err_file")
  if [ "$(grep -c . <<<"$trace")" -gt 2 ]; then
    sed 's/^secli: trace /      wire /' <<<"$trace"
  fi
  printf '  < %s\n' "$shown"
  local line
  if [ -n "$logre" ]; then
    line=$(tail -c +$((daemon_seen + 1)) "$root/daemon.log" | grep -m1 -E -- "$logre" |
      sed -E 's/^(\[[a-z]+\]) [0-9-]+ [0-9:.]+ +[0-9]+ +[0-9]+ /\1 /')
    [ -n "$line" ] && printf '    daemon log: %s\n' "$line"
  fi
  daemon_seen=$(wc -c <"$root/daemon.log")
  if [ -n "$modemre" ]; then
    line=$(tail -c +$((modem_seen + 1)) "$root/modem0.log" | grep -m1 -E -- "$modemre")
    [ -n "$line" ] && printf '    modem0.log: %s\n' "$line"
  fi
  modem_seen=$(wc -c <"$root/modem0.log")
  if [[ $answer =~ $expect ]]; then
    printf '    as expected\n'
  else
    printf '    NOT AS EXPECTED (wanted /%s/)\n' "$expect"
    failed=$((failed + 1))
  fi
}

# The channel number out of the last open's answer.
channel() { [[ $answer =~ channel=([0-9]+) ]] && echo "${BASH_REMATCH[1]}" || echo 0; }

# ---- the device root --------------------------------------------------------------
# The applets of the virtual card (card/card_applets.h).
ECHO=A00000000101   # INS 01: data back; wrong Le answered with 6C xx
BIG=A00000000102    # answers left for GET RESPONSE (61 xx)
NONE=A00000000199   # not on the card

mkdir -p "$root/sys/nfc"
{
  echo "vendor.ese_sim.type=1"                       # an eSE is fitted
  echo "ro.odm.config.modem_number=$((two_modems + 1))"
} >"$root/properties"
# NFC routed to SIM 1, one card, eSE type 0.
echo 1 >"$root/sys/nfc/nfc_sim_switch"
echo 1 >"$root/sys/nfc/nfc_card_num"
echo 0 >"$root/sys/nfc/nfc_wired_ese_type"

echo "Secure element service demo"
echo "device root: $root"
echo
modem0_args=()
[ "$usb" = 1 ] && modem0_args=(--profile usb)
"${pd[@]}" "$bin/modem-sim" --root "$root" --modem 0 "${modem0_args[@]}" --log "$root/modem0.log" \
  >"$root/modem0.out" 2>&1 &
pids+=($!)
wait_for "$root/modem0.out" "ready" || exit 1
echo "modem-sim:   modem 0 on $root/dev/appvcom18 ${modem0_args[*]} (log: modem0.log)"
if [ "$two_modems" = 1 ]; then
  "${pd[@]}" "$bin/modem-sim" --root "$root" --modem 1 --atr 3B8880014D4F44454D31AA --log "$root/modem1.log" \
    >"$root/modem1.out" 2>&1 &
  pids+=($!)
  wait_for "$root/modem1.out" "ready" || exit 1
  echo "modem-sim:   modem 1 on $root/dev/appvcom34 (log: modem1.log)"
fi
daemon_env=()
if [ "$pcsc" = 1 ]; then
  # pcscd: the running one, else our own in the foreground with vpcd's
  # reader on its default port.
  vpcd_port=35963
  reader="Virtual PCD 00 00"
  if [ -f /run/pcscd/pcscd.pid ] && kill -0 "$(cat /run/pcscd/pcscd.pid)" 2>/dev/null; then
    echo "pcscd:       already running (pid $(cat /run/pcscd/pcscd.pid)); vpcd expected on port $vpcd_port"
  else
    mkdir -p "$root/reader.conf.d"
    printf 'FRIENDLYNAME "Virtual PCD"\nDEVICENAME /dev/null:%s\nLIBPATH %s\nCHANNELID %s\n' "$vpcd_port" \
      /usr/lib/pcsc/drivers/serial/libifdvpcd.so "$vpcd_port" >"$root/reader.conf.d/vpcd"
    pcscd_bin=$(command -v pcscd || echo /usr/sbin/pcscd)
    "${pd[@]}" "$pcscd_bin" --foreground --info -c "$root/reader.conf.d" >"$root/pcscd.log" 2>&1 &
    pids+=($!)
    wait_for "$root/pcscd.log" "daemon ready" || { cat "$root/pcscd.log" >&2; exit 1; }
    echo "pcscd:       started in the foreground, vpcd reader on port $vpcd_port (log: pcscd.log)"
  fi
  "${pd[@]}" "$bin/card-vpcd" --port "$vpcd_port" >"$root/card.out" 2>"$root/card.log" &
  card_pid=$!
  pids+=($card_pid)
  wait_for "$root/card.out" "connected" || exit 1
  # pcscd has seen the card once it powers it up.
  wait_for "$root/card.log" "# power on" || exit 1
  echo "card-vpcd:   the virtual card in \"$reader\" (trace: card.log)"
  echo "vendor.ese_pcsc.reader=$reader" >>"$root/properties"
  daemon_env=(LD_LIBRARY_PATH="$build/lib/pcsc")
fi
SE_DEVICE_ROOT=$root "${pd[@]}" env "${daemon_env[@]}" "$bin/qvese@1.0-service" 2>"$root/daemon.log" &
pids+=($!)
wait_for "$root/daemon.log" "Registered sim1 success" || exit 1
wait_for "$root/daemon.log" "AIDL Registered android.hardware.secure_element.ISecureElement/SIM1 success" || exit 1
echo "daemon:      qvese@1.0-service, instances: $("$bin/secli" --root "$root" list | tr '\n' ' ')(log: daemon.log)"

# ---- eSE1 ---------------------------------------------------------------------------
echo
if [ "$pcsc" = 1 ]; then
  echo "== eSE1: a smart card through PC/SC: build/lib/pcsc/libese_qv_hal.so, pcscd, vpcd, card-vpcd =="
else
  echo "== eSE1: the embedded secure element, through the simulated libese_qv_hal.so =="
fi
session_start eSE1
step "init: the daemon opens the eSE and reports connected" '^state=true$' init \
  "phQvEse_init_open"
step "is a card there?" '^present=true$' present
step "ATR (the eSE front gives none)" '^atr=\(empty\)$' atr
step "open a logical channel to the echo applet" '^SUCCESS channel=[1-3] select=6F' "open $ECHO" \
  "Select AID response"
e=$(channel)
step "an APDU on it: data back with 90 00" '^AA BB CC 90 00' "transmit $(cla_of "$e") 01 00 00 03 AA BB CC"
step "wrong Le: the card says 6C 02, secli resends with Le 02" '^AB CD 90 00' \
  "transmit $(cla_of "$e") 01 00 00 02 AB CD 05"
step "open a channel to an applet whose answers come in parts" '^SUCCESS channel=[1-3] select=6F' \
  "open $BIG"
b=$(channel)
step "32 bytes left for GET RESPONSE: 61 20, fetched by secli on channel $b" \
  '^00 01 02 03 .* 1E 1F 90 00' "transmit $(cla_of "$b") 11 00 20 00"
step "close the echo channel" '^SUCCESS$' "close $e"
step "close the other one" '^SUCCESS$' "close $b"
step "an applet the card does not have" '^NO_SUCH_ELEMENT_ERROR' "open $NONE"
step "the basic channel to the echo applet" '^SUCCESS select=6F' "basic $ECHO"
step "an APDU on the basic channel" '^12 34 90 00' "transmit 00 01 00 00 02 12 34"
if [ "$pcsc" = 1 ]; then
  step "open the echo applet once more" '^SUCCESS channel=[1-3] select=6F' "open $ECHO"
  e=$(channel)
  echo
  echo "  # the card is pulled out of the reader (card-vpcd stopped)"
  kill -TERM "$card_pid"
  wait "$card_pid" 2>/dev/null
  # pcscd looks at its readers a few times a second; let it see the card gone.
  if [ -f "$root/pcscd.log" ]; then
    wait_for "$root/pcscd.log" "Card Removed" || exit 1
  else
    sleep 1
  fi
  step "an APDU now: the exchange fails, the front answers 1F" '^1F' \
    "transmit $(cla_of "$e") 01 00 00 01 AA" "SCardTransmit"
  step "a new channel: the card is not ready, IOERROR" '^IOERROR channel=127' "open $ECHO" "KORVA_READY"
  echo
  echo "  # the card is put back (card-vpcd started again)"
  : >"$root/card.log"
  "${pd[@]}" "$bin/card-vpcd" --port "$vpcd_port" >"$root/card.out" 2>"$root/card.log" &
  card_pid=$!
  pids+=($card_pid)
  wait_for "$root/card.log" "# power on" || exit 1
  step "init again: the library connects to the card anew" '^state=true$' init "connected to"
  step "the echo applet answers again" '^SUCCESS channel=[1-3] select=6F' "open $ECHO"
  e=$(channel)
  step "an APDU on it" '^77 90 00' "transmit $(cla_of "$e") 01 00 00 01 77"
fi
session_end

# ---- SIM1 ---------------------------------------------------------------------------
echo
missing='^NO_SUCH_ELEMENT_ERROR'
if [ "$usb" = 1 ]; then
  echo "== SIM1: the SIM card, through AT commands to modem-sim --profile usb =="
  echo "   (a USB modem as plugged in: a tty in the kernel's default settings, command"
  echo "   echo, verbose errors, no AT^CARDTYPE? / AT^CARDATR)"
  session_start SIM1
  step "init: the worker opens the port, a terminal, and puts it in raw mode" '^state=true$' init \
    "raw mode set"
  step "is a card there? AT^CARDTYPE? is unknown to this modem, AT+CPIN? answers" '^present=true$' \
    present "does not know AT\^CARDTYPE" "^< AT\+CPIN"
  step "again: straight to AT+CPIN? (learned for this port)" '^present=true$' present "" "^< AT"
  step "ATR: the modem has no ATR query, the ATR is empty" '^atr=\(empty\)$' atr \
    "does not know AT\^CARDATR"
  # Verbose errors carry no code: a refused open is a plain failure.
  missing='^FAILED'
else
  echo "== SIM1: the SIM card, through AT commands to modem-sim =="
  session_start SIM1
  step "init: the worker for the modem starts, the port is opened" '^state=true$' init \
    "init_at_channel"
  step "is a card there?" '^present=true$' present "CARDTYPE" "CARDTYPE"
  step "ATR" '^atr=3B' atr "" "CARDATR"
fi
step "open a logical channel to the echo applet" \
  '^SUCCESS channel=[0-9]+ select=6F' "open $ECHO" "AT\+CCHP" "AT\+CCHP"
e=$(channel)
step "an APDU on it: the daemon's log masks the command, the modem sees it" \
  '^AA BB CC 90 00' "transmit $(cla_of "$e") 01 00 00 03 AA BB CC" "AT\+CGLA" "^< AT\+CGLA"
step "wrong Le: 6C 02, resent with Le 02" '^AB CD 90 00' "transmit $(cla_of "$e") 01 00 00 02 AB CD 05"
step "open a channel to the applet that answers in parts: its SELECT says 61 1C" \
  '^SUCCESS channel=[0-9]+ select=61 ?1C' "open $BIG"
b=$(channel)
step "the SIM front hands 61 xx to its client, which fetches the FCI itself" \
  '^6F 1A .* 90 00' "transmit $(cla_of "$b") C0 00 00 1C"
step "32 bytes left for GET RESPONSE: 61 20, fetched by secli on channel $b" \
  '^00 01 02 03 .* 1E 1F 90 00' "transmit $(cla_of "$b") 11 00 20 00"
step "close the echo channel" '^SUCCESS$' "close $e" "" "^< AT\+CCHC"
step "close the other one" '^SUCCESS$' "close $b"
step "an applet the card does not have" "$missing" "open $NONE" "" "CME ERROR"
step "the basic channel: SIM1 refuses it, CHANNEL_NOT_AVAILABLE is the right answer" \
  '^CHANNEL_NOT_AVAILABLE' "basic $ECHO" "openBasicChannel"
step "APDUs on the basic channel itself still go through, by AT+CSIM" '^9F 7F .*90 00' \
  "transmit 00 CA 9F 7F 00" "" "^< AT\+CSIM"
if [ "$two_modems" = 1 ]; then
  echo
  echo "  # NFC switched to SIM 2 (sys/nfc/nfc_sim_switch 2, nfc_card_num 3): the next call goes to modem 1"
  echo 3 >"$root/sys/nfc/nfc_card_num"
  echo 2 >"$root/sys/nfc/nfc_sim_switch"
  step "ATR, now from modem 1" '^atr=3B 88 80 01 4D 4F 44 45 4D 31 AA$' atr "selectmodem=1"
  echo 1 >"$root/sys/nfc/nfc_card_num"
  echo 1 >"$root/sys/nfc/nfc_sim_switch"
  # (with --usb-modem, modem 0 has no ATR query: empty)
  modem0_atr='^atr=3B 86'
  [ "$usb" = 1 ] && modem0_atr='^atr=\(empty\)$'
  step "switched back: modem 0 again" "$modem0_atr" atr "selectmodem=0"
fi
session_end
if [ "$usb" = 1 ]; then
  # With its tty left cooked, the modem would get its own answers back as
  # commands: every line it received must be one of the daemon's.
  steps=$((steps + 1))
  received=$(grep -c '^< ' "$root/modem0.log")
  stray=$(grep '^< ' "$root/modem0.log" | grep -vc '^< AT')
  printf '\n  # what the modem received: %s lines, %s of them not an AT command from the daemon\n' \
    "$received" "$stray"
  if [ "$stray" -eq 0 ] && [ "$received" -gt 0 ]; then
    printf '    as expected\n'
  else
    printf '    NOT AS EXPECTED\n'
    failed=$((failed + 1))
  fi
fi

# ---- eSE1 over AIDL -------------------------------------------------------------------
echo
echo "== eSE1 over AIDL (android.hardware.secure_element.ISecureElement/eSE1): the same card =="
session_start eSE1 --aidl
step "init: onStateChange(true) with a reason" '^SUCCESS state=true reason="eSE1 is ready"$' init \
  "phQvEse_init_open"
step "open a logical channel to the echo applet" '^SUCCESS channel=[1-3] select=6F' "open $ECHO"
e=$(channel)
step "an APDU on it" '^SUCCESS AA BB CC 90 00' "transmit $(cla_of "$e") 01 00 00 03 AA BB CC"
step "an applet the card does not have: the error comes as a status" '^NO_SUCH_ELEMENT_ERROR' \
  "open $NONE"
step "reset: channels closed, the eSE closed and opened again, states false then true" \
  '^SUCCESS states=false,true$' reset "phQvEse_close"
step "the channel is gone after the reset" '^CHANNEL_NOT_AVAILABLE' \
  "transmit $(cla_of "$e") 01 00 00 01 AA"
session_end

echo
if [ "$failed" -eq 0 ]; then
  echo "demo: all $steps steps gave what they should"
  exit 0
fi
echo "demo: $failed of $steps steps did not give what they should (daemon log: $root/daemon.log; --keep keeps it)"
exit 1
