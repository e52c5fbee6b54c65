# Draws the pictures of docs/performance.md from what the programs have measured. script/bench --plot calls it:
#   gnuplot -e "figures='FOLDER'; pictures='FOLDER'" bench/figures.gp
# All colours are legible on white and on black; the background is transparent, and text stays text.

grey = "#858585"
set terminal svg size 880,500 fixed font "sans-serif,14" noenhanced
set border 3 linecolor rgb grey
set tics nomirror textcolor rgb grey
set grid linecolor rgb grey linewidth 0.3
set key textcolor rgb grey left top Left reverse
set title textcolor rgb grey
set xlabel textcolor rgb grey
set ylabel textcolor rgb grey
set style line 1 linecolor rgb "#e0662a" linewidth 2.5 pointtype 7 pointsize 0.7
set style line 2 linecolor rgb "#2f9e6e" linewidth 2.5 pointtype 5 pointsize 0.7
set style line 3 linecolor rgb "#c25aa8" linewidth 2.5 pointtype 9 pointsize 0.8
set style line 4 linecolor rgb "#3a8fd0" linewidth 1.5 pointtype 6 pointsize 0.7
set style line 5 linecolor rgb "#a08a1f" linewidth 1.5 pointtype 4 pointsize 0.7
set style line 6 linecolor rgb "#858585" linewidth 1.5 pointtype 8 pointsize 0.7

# The rows of contests.tsv whose work begins with a text, as: bytes, nanoseconds. The column is 3 for ours, 4 for theirs.
rows(work, rival, column) = "< awk -F '\\t' '$1 ~ /^" . work . ": one way, / && $2 == \"" . rival . "\" { n = $1; " . \
    "sub(/.*, /, \"\", n); split(n, part, \" \"); print part[1] * (part[2] == \"KiB\" ? 1024 : 1), $" . column . " }' " . \
    figures . "/contests.tsv"

set output pictures . "/throughput.svg"
set title "Messages in one direction over loopback, both ends on one core"
set xlabel "bytes of a message"
set ylabel "messages a second"
set logscale xy
set xtics (64, 256, "1 Ki" 1024, "4 Ki" 4096, "16 Ki" 16384)
set format y "%.0f"
set xrange [48:22000]
set yrange [10000:50000000]
set ytics ("10 000" 1e4, "100 000" 1e5, "1 000 000" 1e6, "10 000 000" 1e7)
set key left bottom
plot rows("buffered", "ZeroMQ", 3) using 1:(1e9/$2) with linespoints linestyle 1 title "ours, buffered", \
     rows("queue and writer thread", "ZeroMQ", 3) using 1:(1e9/$2) with linespoints linestyle 2 \
         title "ours, behind queue and writer thread", \
     rows("buffered", "unbuffered", 4) using 1:(1e9/$2) with linespoints linestyle 3 title "ours, unbuffered", \
     rows("buffered", "ZeroMQ", 4) using 1:(1e9/$2) with linespoints linestyle 4 title "ZeroMQ", \
     rows("buffered", "Boost.Asio", 4) using 1:(1e9/$2) with linespoints linestyle 5 title "Boost.Asio", \
     rows("buffered", "a raw socket", 4) using 1:(1e9/$2) with linespoints linestyle 6 title "a raw socket"

kind(name) = "< awk -F '\\t' '$1 == \"" . name . "\"' " . figures . "/consoles.tsv"
set output pictures . "/consoles.svg"
set title "qel bench and qel serve on one core, messages of 64 bytes"
set xlabel "consoles"
set ylabel "microseconds"
unset xtics
set xtics nomirror (2, 8, 32, 128, 254) textcolor rgb grey
unset ytics
set ytics nomirror (1, 10, 100, "1000" 1000, "10 000" 10000, "100 000" 100000) textcolor rgb grey
set xrange [1.6:320]
set yrange [10:*]
set key below maxrows 2
plot kind("TLS") using 2:5 with linespoints linestyle 1 title "TLS, p99", \
     kind("TLS") using 2:4 with linespoints linestyle 3 title "TLS, p50", \
     kind("plain") using 2:5 with linespoints linestyle 2 title "plain, p99", \
     kind("plain") using 2:4 with linespoints linestyle 4 title "plain, p50", \
     kind("TLS") using 2:3 with linespoints linestyle 1 dashtype 2 title "TLS, a message", \
     kind("plain") using 2:3 with linespoints linestyle 2 dashtype 2 title "plain, a message"

limited = "< awk -F '\\t' '$5 > 0 { print ++n \"\\t\" $3 / $4 \"\\t\" $5 \"\\t\" $1 \" | \" $2 }' " . figures . "/contests.tsv"
set output pictures . "/peers.svg"
set xrange [*:*] # ranges hide records from stats, too
set yrange [*:*]
stats limited using 1 nooutput
set terminal svg size 880,(60 + 22 * STATS_records) fixed font "sans-serif,13" noenhanced
set title "Our time as a part of others'; the marks are what it may be at most" offset -20,0
unset logscale
unset xlabel
unset ylabel
unset key
unset xtics
unset ytics
set datafile separator tab
set xrange [0:2]
set yrange [STATS_records + 0.6:0.4]
unset grid
set grid xtics linecolor rgb grey linewidth 0.3
set xtics nomirror scale 0 0, 0.5, 2 textcolor rgb grey
set ytics nomirror scale 0 textcolor rgb grey
set format x "%g"
set lmargin 68
set style fill solid 0.75 noborder
plot limited using (0):1:(0):2:($1 - 0.32):($1 + 0.32):(($2 <= $3) ? 0x2f9e6e : 0xe0662a):ytic(4) \
         with boxxyerror linecolor rgb variable, \
     limited using 3:1:($3 - 0.006):($3 + 0.006):($1 - 0.45):($1 + 0.45) with boxxyerror linecolor rgb grey
