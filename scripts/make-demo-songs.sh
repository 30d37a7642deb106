#!/bin/sh
# Generates short tagged demo songs for trying out the local player:
#   DIR/tone-440.mp3   A4  (440 Hz)  title "Demo Tone A440"  (ID3 tags)
#   DIR/tone-660.flac  E5  (660 Hz)  title "Demo Tone E660"  (Vorbis comments)
#   DIR/tone-880.ogg   A5  (880 Hz)  title "Demo Tone A880"  (Vorbis comments)
# every one a stereo 44.1 kHz sine of SECONDS seconds (default 3) by the
# artist "Tarn Demo Band" on the album "Tarn Demo Tones".
#
#   scripts/make-demo-songs.sh DIR [SECONDS]
#
# Needs sox, lame, flac/metaflac and oggenc (scripts/setup.sh installs them).
set -eu

if [ $# -lt 1 ] || [ $# -gt 2 ]; then
    echo "usage: $0 DIR [SECONDS]" >&2
    exit 2
fi
dir=$1
seconds=${2:-3}
case $seconds in
    ''|*[!0-9.]*) echo "$0: SECONDS must be a positive number, not '$seconds'" >&2; exit 2 ;;
esac

for tool in sox lame flac metaflac oggenc; do
    if ! command -v "$tool" >/dev/null 2>&1; then
        echo "$0: '$tool' is missing; run scripts/setup.sh (as root) to install it" >&2
        exit 1
    fi
done

mkdir -p "$dir"
work=$(mktemp -d "${TMPDIR:-/tmp}/demo-songs.XXXXXX")
trap 'rm -rf "$work"' EXIT INT TERM

artist="Tarn Demo Band"
album="Tarn Demo Tones"

tone() {   # tone FREQ OUTWAV
    sox -q -n -r 44100 -c 2 -b 16 "$2" synth "$seconds" sine "$1" gain -6
}

# MP3 with ID3v1 and ID3v2 tags.
tone 440 "$work/440.wav"
lame --quiet -b 192 --add-id3v2 --tt "Demo Tone A440" --ta "$artist" --tl "$album" \
    --ty 2024 --tn 1 --tg Electronic "$work/440.wav" "$dir/tone-440.mp3"
echo "made $dir/tone-440.mp3 (440 Hz, ${seconds} s)"

# FLAC tagged with metaflac.
tone 660 "$work/660.wav"
flac --silent --force -o "$dir/tone-660.flac" "$work/660.wav"
metaflac --remove-all-tags --set-tag="TITLE=Demo Tone E660" --set-tag="ARTIST=$artist" \
    --set-tag="ALBUM=$album" --set-tag="DATE=2024" --set-tag="TRACKNUMBER=2" \
    --set-tag="GENRE=Electronic" "$dir/tone-660.flac"
echo "made $dir/tone-660.flac (660 Hz, ${seconds} s)"

# Ogg Vorbis tagged by the encoder.
tone 880 "$work/880.wav"
oggenc --quiet -q 4 -t "Demo Tone A880" -a "$artist" -l "$album" -d 2024 -N 3 -G Electronic \
    -o "$dir/tone-880.ogg" "$work/880.wav"
echo "made $dir/tone-880.ogg (880 Hz, ${seconds} s)"
