#!/usr/bin/env bash
# Builds zrd, starts it in a directory of its own with the example applications, and shows what zrctl
# finds. Nothing outside that directory and build/ is touched; everything started here ends here.
set -euo pipefail
cd "$(dirname "$0")/.."

say() { printf '\n\033[1m%s\033[0m\n' "$*"; }

scripts/deps.sh
say "Building (the first time takes a few minutes)"
cmake --preset release > /dev/null
cmake --build --preset release --target zrd zrctl
PATH=$PWD/build/release/zrd:$PWD/build/release/tools/zrctl:$PATH

home=$(mktemp -d /tmp/zrd-demo.XXXXXX)
daemon=
watcher=
finish() {
    local process
    for process in $daemon $watcher; do
        kill "$process" 2> /dev/null || true
        wait "$process" 2> /dev/null || true
    done
    rm -rf "$home"
}
trap finish EXIT
trap 'exit 130' INT
trap 'exit 143' TERM

# A home of its own; of the system only the data that is shared by all users, such as the MIME types.
export XDG_RUNTIME_DIR=$home/run XDG_DATA_HOME=$home/data XDG_CONFIG_HOME=$home/config
export XDG_STATE_HOME=$home/state XDG_DATA_DIRS=/usr/local/share:/usr/share
mkdir -m 700 "$XDG_RUNTIME_DIR"
mkdir -p "$XDG_DATA_HOME/zorvan" "$XDG_CONFIG_HOME/zorvan/ByHost"
cp -R examples/Applications examples/SDKs "$XDG_DATA_HOME/zorvan/"
machine=$(cat /etc/machine-id 2> /dev/null || true)
cp examples/exclusions.plist \
    "$XDG_CONFIG_HOME/zorvan/ByHost/com.orbel.zorvan.userprefs.${machine:-local}.plist"
applications=$XDG_DATA_HOME/zorvan/Applications

say "Starting zrd in $home, which holds three example applications"
ZR_LOG=info zrd 2> "$home/log" &
daemon=$!
for _ in $(seq 100); do
    zrctl match > /dev/null 2>&1 && break
    kill -0 "$daemon" 2> /dev/null || break
    sleep 0.1
done

# What follows the explanation is shown and run; finding nothing is an answer like any other.
show() {
    say "$1"
    shift
    printf '$'
    local word
    for word in "$@"; do
        case $word in
            *[!A-Za-z0-9=./_:-]*) printf " '%s'" "$word" ;;
            *) printf ' %s' "$word" ;;
        esac
    done
    printf '\n'
    local status=0
    "$@" || status=$?
    if [ "$status" -gt 1 ]; then
        printf 'The demo stops here; the log of zrd:\n' >&2
        cat "$home/log" >&2
        exit 1
    fi
}

# Waits, a few seconds at most, until the command ends with the status.
soon() {
    local expected=$1 status
    shift
    for _ in $(seq 50); do
        status=0
        "$@" > /dev/null 2>&1 || status=$?
        [ "$status" = "$expected" ] && return
        sleep 0.1
    done
}

show "All plug-ins that this caller may use, of each identifier the newest version:" \
    zrctl match
show "Those of one extension point:" \
    zrctl match VXExtensionPointIdentifier=com.example.text-transform
show "Two applications bring a plug-in of one identifier; here are both versions:" \
    zrctl match --versions VXExtensionIdentifier=com.example.shout
show "Versions compare by number: 1.9 is less than 1.10." \
    zrctl match VXExtensionIdentifier=com.example.shout 'VXExtensionVersion=<1.10'
show "Rules look at attributes: what takes pictures of one of two types? (The same key twice: either.)" \
    zrctl match InputTypes=image/gif InputTypes=image/svg+xml
show "Types have a hierarchy: what takes any kind of text? Most have that from the dictionary of their
extension point, not from their own Info.plist. (SVG pictures are XML, and that is text.)" \
    zrctl match --all 'InputTypes=?UT-CONFORMS:text/plain'
show "A host that offers two PNG pictures to share asks with a rules file; the plug-ins' own activation
rules decide:" \
    zrctl match --rules examples/share-rules.plist
show "One plug-in replaces another; both are listed and marked, and share one election:" \
    zrctl match --long InputTypes=image/png
show "It asked to be elected when it was installed. What is elected?" \
    zrctl match VXUserElection=1
show "A manager may also see what it could not use itself: a plug-in made for its own application only
(Outline), and one that demands an entitlement of its host (Sealed Letter). The Telegraph is
excluded by the user's preferences and stays out." \
    zrctl match --all
show "Nothing of this lies on the system volume:" \
    zrctl match --system-only
show "For programs there are the plug-ins' forms, whole, as JSON and as property lists:" \
    sh -c 'zrctl match --json VXExtensionIdentifier=com.example.paintbox.frames | head -n 20'
show "A plug-in is taken out ..." \
    zrctl remove "$applications/Scribe.app/PlugIns/WordCount.appex"
show "... and is not found any more ..." \
    zrctl match VXExtensionIdentifier=com.example.scribe.word-count
show "... until it is added again:" \
    zrctl add "$applications/Scribe.app/PlugIns/WordCount.appex"
show "There it is:" \
    zrctl match VXExtensionIdentifier=com.example.scribe.word-count
show "The user decides what is used. An election is kept under a plug-in's identifier and outlives zrd:" \
    zrctl elect ignore com.example.scribe.word-count
show "Hosts may keep data of their own with a plug-in, and so may you:" \
    zrctl annotate com.example.scribe.word-count language=en pinned=true
show "Both come back with every match; it is the host that leaves out what is ignored:" \
    zrctl match --long VXExtensionIdentifier=com.example.scribe.word-count
show "An identifier that several plug-ins have is not enough to say which one is meant:" \
    sh -c 'zrctl elect use com.example.shout 2>&1 || true'
show "What is excluded is in no match at all. Besides the Telegraph, which the preferences had excluded,
now everything from version 2.0 on:" \
    zrctl exclude add 'VXExtensionVersion=>=2.0'
show "The rules, written as \"exclude remove\" takes them:" \
    zrctl exclude list
show "Image Preview, version 2.0, is gone ..." \
    zrctl match InputTypes=image/png
show "... until its rule is removed:" \
    zrctl exclude remove 'VXExtensionVersion=>=2.0'
say "Every choice is announced to whoever waits for it; here is what \"zrctl watch\" writes meanwhile:"
zrctl watch > "$home/watch" &
watcher=$!
for _ in $(seq 100); do
    zrctl elect default com.example.scribe.word-count
    [ -s "$home/watch" ] && break
    sleep 0.1
done
kill "$watcher"
wait "$watcher"
watcher=
tail -n 1 "$home/watch"
say "Applications come and go while zrd runs. Paintbox is taken away:"
mv "$applications/Paintbox.app" "$home/"
soon 1 zrctl match VXExtensionIdentifier=com.example.paintbox.frames
show "Its plug-ins went with it, and of Shout there is only Scribe's older version left:" \
    zrctl match
say "Paintbox is copied in again:"
cp -R "$home/Paintbox.app" "$applications/"
soon 0 zrctl match VXExtensionIdentifier=com.example.paintbox.frames
show "Nobody had to tell zrd:" \
    zrctl match
say "Two bundles were refused; the log says which and why:"
sed -n -e 's/.*\(leaving out a plug-in.*\)/\1/p' -e 's/.*\(ignoring mis-configured.*\)/\1/p' "$home/log" |
    sort -u

say "Stopping zrd. Try it yourself: README.md says how."
